// Emptying and removing dataclasses on the server.
#include <chrono>

#include "VantorSyncManager/NubiloException.h"
#include "VantorSyncManager/NubiloRemoteSession.h"
#include "VantorSyncManager/PublicNames.h"
#include "VantorSyncManager/StringAdditions.h"
#include "common/Clock.h"
#include "common/Logging.h"
#include "common/Uuid.h"
#include "platform/dav/DavPaths.h"
#include "platform/dav/TesselSession.h"

namespace {

constexpr const char* kTrash = "/Web/.Temporary Web Resources/SyncWorks/Trash/";
constexpr const char* kObsoleteTrash = "/.TWR/";

}  // namespace

bool NubiloRemoteSession::unregisterDataclass(const std::string& dataclass) {
  lockDataclass(dataclass);
  resetDataclass(dataclass);
  setStatus("needstruth", _configuration.get("guid").string(), dataclass);
  unlockDataclass(dataclass);
  lockDataclasses();
  DavTransaction removal =
      _TesselSession->deleteResourceAtPath(vtc::davpath::collection(dataclassPath(dataclass)));
  unlockDataclasses();
  return removal.isSuccessful();
}

bool NubiloRemoteSession::resetDataclass(const std::string& dataclass) {
  // Collections, named as such: with their trailing "/".
  const std::string path = vtc::davpath::collection(dataclassPath(dataclass));
  relockDataclass(dataclass);
  const std::string trash = pathInShare(kTrash);
  const std::string trashTarget = vtc::davpath::collection(stringByAppendingTesselPathComponent(
      vtc::davpath::canonical(trash), dataclass + vtc::makeUUIDString()));
  if (!_issuePropFindWithRetryAtPath(trash, kDAVZeroDepth, {kNBLastModified}).isSuccessful())
    _TesselSession->makeCollectionAtPath(trash, true);

  lockClients();
  try {
    unlockDataclass(dataclass);
    lockDataclasses();
    DavTransaction move = _TesselSession->moveResourceAtPath(path, trashTarget);
    unlockDataclasses();
    if (move.isSuccessful()) {
      registerDataclass(dataclass);  // a new, empty collection with no versions or status
      lockDataclass(dataclass);
    } else {
      VTC_LOG_WARNING(
          "Failed to move %@ dataclass collection aside for reset (probably too many clogs), "
          "reverting to removing clogs individually",
          dataclass);
      messageTraceTransactionFailure(move, false, 0, "Failed to move dataclass aside for reset");
      vtc::Dictionary record = getDataclassInfo(dataclass);
      const vtc::Value* min = record.find("minversion");
      const vtc::Value* max = record.find("maxversion");
      // Without both bounds nothing is deleted and the dataclass stays
      // unlocked: the one path that ends without its lock.
      if (min && max) {
        lockDataclass(dataclass);
        const auto halfLock = std::chrono::duration<double>(_lockDuration / 2.0);
        auto renewBy =
            vtc::currentClock().now() + std::chrono::duration_cast<vtc::Date::duration>(halfLock);
        for (int64_t index = min->integer(); index <= max->integer(); ++index) {
          if (renewBy < vtc::currentClock().now()) {
            relockDataclass(dataclass);
            relockClients();
            renewBy = vtc::currentClock().now() +
                      std::chrono::duration_cast<vtc::Date::duration>(halfLock);
          }
          _TesselSession->deleteResourceAtPath(changeLogPathForDataclass(dataclass, index));
          VTC_LOG_INFO("Removing changelog %i for dataclass %@", index, dataclass);
        }
        setInfoForDataclass(vtc::Dictionary{{"status", kNBRemoveProp},
                                            {"minversion", kNBRemoveProp},
                                            {"maxversion", kNBRemoveProp}},
                            dataclass);
      }
    }
    setOtherClientStatus("needstruth", dataclass);
    const std::string obsolete = pathInShare(kObsoleteTrash);
    if (_TesselSession->_issuePropFindAtPath(obsolete, kDAVZeroDepth, {kNBLastModified})
            .isSuccessful()) {
      VTC_LOG_INFO("Obsolete .TWR collection found while resetting dataclass, performing cleanup");
      _TesselSession->deleteResourceAtPath(obsolete);
    }
  } catch (const std::exception& e) {
    VTC_LOG_WARNING("exception %@ raised wile trying to reset dataclass %@", e.what(), dataclass);
    unlockClients();
    throw;
  }
  unlockClients();
  return false;
}
