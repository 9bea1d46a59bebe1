#include "platform/network/InterfaceAddresses.h"

#include <arpa/inet.h>
#include <ifaddrs.h>
#include <netinet/in.h>


#include "VantorSyncManager/Diagnostics.h"
#include "common/Seam.h"

namespace vtc::network {

namespace {
Seam<std::optional<std::vector<std::string>>()> gSource;
}  // namespace

void installAddressSource(AddressSource source) { gSource.install(std::move(source)); }

std::optional<std::vector<std::string>> ipv4Addresses() {
  if (auto source = gSource.current()) return source();
  ifaddrs* list = nullptr;
  if (getifaddrs(&list) != 0) return std::nullopt;
  std::vector<std::string> out;
  for (ifaddrs* i = list; i; i = i->ifa_next) {
    if (!i->ifa_addr || i->ifa_addr->sa_family != AF_INET) continue;
    char text[INET_ADDRSTRLEN];
    const auto* in = reinterpret_cast<const sockaddr_in*>(i->ifa_addr);
    if (inet_ntop(AF_INET, &in->sin_addr, text, sizeof text)) out.emplace_back(text);
  }
  freeifaddrs(list);
  return out;
}

}  // namespace vtc::network

// Asked afresh on every call: interfaces come and go.
extern "C" VSM_EXPORT bool isKorvoInternal(void) {
  auto addresses = vtc::network::ipv4Addresses();
  if (!addresses) return false;
  for (const std::string& a : *addresses)
    if (a.starts_with(vtc::network::kInternalNetworkPrefix)) return true;
  return false;
}
