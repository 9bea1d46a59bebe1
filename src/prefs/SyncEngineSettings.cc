#include "prefs/SyncEngineSettings.h"

namespace vtc {

std::string strippedClientName(const std::string& name) {
  return name;
}

std::optional<Date> engineLastSuccessfulSyncDate() {
  return std::nullopt;
}

void removeEngineLastSuccessfulSyncDate() {}

void setSyncsAfterOtherClients(bool) {}

}  // namespace vtc
