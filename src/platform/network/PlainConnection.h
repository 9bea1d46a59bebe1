// A password sent without TLS can be read by anyone on the network between:
// the connections that carry one say so each time, unless the server is this
// computer itself (a loopback name or address), where nothing crosses a wire.
#pragma once

#include <optional>
#include <string>
#include <string_view>

namespace vtc::network {

// "localhost", 127.0.0.0/8, ::1 (with or without brackets).
bool isLoopbackHost(std::string_view host);

// The sentence warning that user's password goes unencrypted to url (over
// protocol, "HTTP" or "MQTT"), or none when it stays on this computer.
std::optional<std::string> passwordInClearWarning(const std::string& user, const std::string& host,
                                                  const std::string& url, const char* protocol);

}  // namespace vtc::network
