#include "VantorSyncManager/DataclassMaintenance.h"

#include <exception>
#include <memory>

#include "VantorSyncManager/NubiloRemoteSession.h"
#include "VantorSyncManager/VTCPrefsCenter.h"
#include "common/Logging.h"
#include "session/DataclassName.h"

namespace {

std::unique_ptr<NubiloRemoteSession> openSession() {
  return NubiloRemoteSession::sessionFromPreferencesWithConfiguration(
      VTCPrefsCenter::defaultCenter().configuration());
}

}  // namespace

bool removeNubiloDataclasses(const std::vector<std::string>& dataclasses) {
  try {
    auto session = openSession();
    bool removedAll = true;
    for (const std::string& dataclass : dataclasses) {
      VTC_LOG_INFO("Unregistering dataclass:%@", dataclass);
      removedAll = session->unregisterDataclass(dataclass) && removedAll;
    }
    return removedAll;
  } catch (const std::exception& e) {
    VTC_LOG_ERROR("exception %@ while trying to unregister dataclasses %@", e.what(), dataclasses);
    return false;
  }
}

std::optional<int64_t> approximateStorageUsedByDataclass(const std::string& dataclass) {
  VTCPrefsCenter& prefs = VTCPrefsCenter::defaultCenter();
  // The recorded value is kept until the preferences replace or clear it.
  vtc::Value recorded = prefs.storageConsumedForDataclass(dataclass);
  if (!recorded.isNone()) return recorded.integer();
  std::optional<int64_t> bytes;
  try {
    bytes = openSession()->calculateStorageConsumedForDataclass(dataclass);
    prefs.setStorageConsumed(vtc::Value(*bytes), dataclass);
  } catch (const std::exception& e) {
    // A count made before the failure (in recording it) is still returned.
    VTC_LOG_ERROR("exception %@ while trying to retrieve storage consumed by dataclass %@",
                  e.what(), dataclass);
  }
  return bytes;
}

std::optional<vtc::Array> registeredDataclasses() {
  try {
    auto session = openSession();
    vtc::Array names;
    for (const vtc::Value& record : session->getAllDataclassInfo()) {
      // A name from the share that no caller could use as a dataclass is left out.
      const vtc::Value& name = record.dictionary().get("dataclassname");
      if (name.isString() && !vtc::isPlainDataclassName(name.string())) continue;
      names.push_back(name);
    }
    return names;
  } catch (const std::exception& e) {
    VTC_LOG_ERROR("exception %@ while trying to retrieve registered dataclasses", e.what());
    return std::nullopt;
  }
}
