#include "prefs/SyncEngineSettings.h"

#include "VantorSyncManager/NubiloDataAdditions.h"
#include "VantorSyncManager/PublicNames.h"
#include "common/Logging.h"
#include "platform/engine/SyncEngine.h"

namespace vtc {

std::string strippedClientName(const std::string& name) {
  return NubiloStringByStrippingControlCharacters(name);
}

std::optional<Date> engineLastSuccessfulSyncDate() {
  Value date = engine::SyncEngine::open()->objectForKey(kVantorSyncClientId, "lastSuccessSync");
  if (date.kind() != Value::Kind::Date) return std::nullopt;
  return date.date();
}

void removeEngineLastSuccessfulSyncDate() {
  engine::SyncEngine::open()->setObjectForKey(kVantorSyncClientId, "lastSuccessSync", Value());
}

void setSyncsAfterOtherClients(bool on) {
  try {
    auto engine = engine::SyncEngine::open();
    // No record yet: nothing to tell. Registering the client applies the
    // stored choice (getNubiloClient).
    if (!engine->hasClient(kVantorSyncClientId)) return;
    engine->setSyncsAfterClients(kVantorSyncClientId, on);
    engine->setShouldSynchronize(kVantorSyncClientId, on, {"app", "device", "peer"});
  } catch (const std::exception& e) {
    // The preference is stored all the same; the engine learns it when the
    // client is registered again.
    VTC_LOG_ERROR("Could not tell the sync engine about syncing after other clients: %@", e.what());
  }
}

}  // namespace vtc
