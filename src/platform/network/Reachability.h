// Whether a server takes TCP connections at all, asked once and briefly: a
// server that is down or an address that leads nowhere is told at once,
// instead of after the retries a request gets for a passing fault.
#pragma once

#include <optional>
#include <string>

namespace vtc::network {

// Why no connection to host:port could be made within the time given
// ("connection refused", "no such host"), or none when one could.
std::optional<std::string> whyUnreachable(const std::string& host, int port, double seconds);

}  // namespace vtc::network
