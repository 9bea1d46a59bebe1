// Process and sync status utilities.
#include "VantorSyncManager/SyncStatus.h"

#include <signal.h>

#include <cerrno>
#include <fstream>

#include "VantorSyncManager/NubiloException.h"
#include "VantorSyncManager/PublicNames.h"
#include "VantorSyncManager/VTCPrefsCenter.h"
#include "common/Logging.h"
#include "platform/bundle/BundleResources.h"
#include "platform/engine/SyncEngine.h"
#include "platform/fs/LocalPaths.h"
#include "platform/plist/PlistCodec.h"
#include "prefs/SyncEngineSettings.h"

namespace {

constexpr const char* kOwnerFile = ".owner.pid";

}  // namespace

SyncEngineClientRecord::SyncEngineClientRecord(std::string identifier, vtc::Dictionary description)
    : identifier_(std::move(identifier)), description_(std::move(description)) {}

vtc::Value SyncEngineClientRecord::objectForKey(const std::string& key) const {
  return vtc::engine::SyncEngine::open()->objectForKey(identifier_, key);
}

void SyncEngineClientRecord::setObject(const vtc::Value& value, const std::string& key) {
  vtc::engine::SyncEngine::open()->setObjectForKey(identifier_, key, value);
}

std::shared_ptr<SyncEngineClientRecord> getNubiloClient() {
  try {
    auto engine = vtc::engine::SyncEngine::open();
    auto path = vtc::bundle::pathForResource("NBSC-ClientDescription", "plist");
    if (!path)
      throw NubiloException("NSInvalidArgumentException",
                            "the resource NBSC-ClientDescription.plist of bundle " +
                                std::string(vtc::bundle::kBundleIdentifier) + " is not installed");
    auto description = vtc::plist::readFile(*path);
    if (!description || !description->isDictionary())
      throw NubiloException("NSInvalidArgumentException",
                            "the client description " + *path + " is no property list");
    const bool known = engine->hasClient(kVantorSyncClientId);
    engine->registerClient(kVantorSyncClientId, description->dictionary());
    // A choice of syncing after other clients made before the record
    // existed takes effect now.
    if (!known)
      vtc::setSyncsAfterOtherClients(VTCPrefsCenter::defaultCenter().automaticallySyncOn());
    return std::make_shared<SyncEngineClientRecord>(kVantorSyncClientId, description->dictionary());
  } catch (const NubiloException& e) {
    VTC_LOG_ERROR("Exception caught while getting the XSyncClient in getVantorClient -  %@ %@",
                  e.reason(), e.name());
  } catch (const vtc::engine::EngineError& e) {
    VTC_LOG_ERROR("Exception caught while getting the XSyncClient in getVantorClient -  %@ %@",
                  e.what(), "EngineError");
  }
  return nullptr;
}

std::shared_ptr<SyncEngineClientRecord> getVantorClient() {
  return getNubiloClient();
}

vtc::Dictionary getVanterConfiguration() {
  return VTCPrefsCenter::defaultCenter().configuration();
}

extern "C" bool isProcessRunning(int32_t pid) {
  if (::kill(pid, 0) == 0) return true;
  return errno == EPERM;  // it exists, but belongs to another user
}

extern "C" bool NubiloIsRunning(void) {
  auto folder = VTCPrefsCenter::applicationSupportDirectory();
  if (!folder) return false;
  std::ifstream in(vtc::paths::join(*folder, kOwnerFile));
  std::string text;
  if (!in || !std::getline(in, text)) return false;
  const int64_t pid = vtc::Value(text).integer();
  if (pid < 1 || pid > INT32_MAX) return false;
  return isProcessRunning(static_cast<int32_t>(pid));
}

extern "C" bool NubiloCurrentlySyncing(void) {
  try {
    auto plans = vtc::engine::SyncEngine::open()->currentSyncPlans();
    for (const auto& plan : plans) {
      if (plan.status != 7 && plan.status != 1) continue;
      for (const std::string& participant : plan.participants)
        if (participant == kVantorSyncClientId) return true;
    }
  } catch (const vtc::engine::EngineError& e) {
    VTC_LOG_ERROR("Exception %@ thrown while trying to determine if Nubilo is currently Syncing",
                  e.what());
  }
  return NubiloIsRunning();
}
