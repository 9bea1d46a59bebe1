#include "platform/network/PlainConnection.h"

#include <arpa/inet.h>

namespace vtc::network {

bool isLoopbackHost(std::string_view host) {
  if (host.starts_with('[') && host.ends_with(']')) host = host.substr(1, host.size() - 2);
  if (host == "localhost" || host.ends_with(".localhost")) return true;
  const std::string text(host);
  in_addr v4{};
  if (::inet_pton(AF_INET, text.c_str(), &v4) == 1) return (ntohl(v4.s_addr) >> 24) == 127;
  in6_addr v6{};
  return ::inet_pton(AF_INET6, text.c_str(), &v6) == 1 && IN6_IS_ADDR_LOOPBACK(&v6);
}

std::optional<std::string> passwordInClearWarning(const std::string& user, const std::string& host,
                                                  const std::string& url, const char* protocol) {
  if (isLoopbackHost(host)) return std::nullopt;
  return "The password for " + user + " goes unencrypted to " + url + " (plain " + protocol +
         "): anyone on the network between can read it.";
}

}  // namespace vtc::network
