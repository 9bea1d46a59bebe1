// The IPv4 addresses of this computer's network interfaces (getifaddrs), with
// a replaceable source for tests.
#pragma once

#include <functional>
#include <optional>
#include <string>
#include <vector>

namespace vtc::network {

// Dotted IPv4 addresses of every interface; nullopt when they cannot be read.
std::optional<std::vector<std::string>> ipv4Addresses();

using AddressSource = std::function<std::optional<std::vector<std::string>>()>;
// An empty function restores getifaddrs.
void installAddressSource(AddressSource source);

// The address prefix of the maker's internal network, matched as text.
inline constexpr const char* kInternalNetworkPrefix = "10.96.";

}  // namespace vtc::network
