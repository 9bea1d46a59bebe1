#include "support/SharePreferences.h"

#include "VantorSyncManager/PublicNames.h"
#include "platform/prefs/PreferenceStore.h"

namespace vtc::test {

void storeShareInPreferences(const Share& share, int port) {
  auto& store = prefs::PreferenceStore::shared();
  Dictionary keys = share.configuration();
  for (const char* identity : {"Name", "guid", "ClientGuid", "ClientName"}) keys.erase(identity);
  if (port) keys.set("host_port", Value(port));
  for (const auto& [key, value] : keys)
    store.setValue(key, value, kVantorDefaultsKey, prefs::Scope::AnyHost);
  store.synchronize(kVantorDefaultsKey, prefs::Scope::AnyHost);
}

}  // namespace vtc::test
