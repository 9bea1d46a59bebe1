#include "prefs/SyncEngineSettings.h"

#include "VantorSyncManager/NubiloDataAdditions.h"

#include "VantorSyncManager/NubiloDataAdditions.h"

namespace vtc {

std::string strippedClientName(const std::string& name) {
  return NubiloStringByStrippingControlCharacters(name);
}

std::optional<Date> engineLastSuccessfulSyncDate() {
  return std::nullopt;
}

void removeEngineLastSuccessfulSyncDate() {}

void setSyncsAfterOtherClients(bool) {}

}  // namespace vtc
