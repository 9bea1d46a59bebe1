// The commit protocol: upload under a private name, publish the new
// maxversion, move into place without overwriting, roll back on failure.
// After every step the server is in a state that a reader either does not
// see (a stray temporary file) or can detect and repair (a record naming a
// changelog that is not there yet).
#include <unistd.h>

#include <chrono>

#include "VantorSyncManager/NubiloException.h"
#include "VantorSyncManager/NubiloRemoteSession.h"
#include "VantorSyncManager/PublicNames.h"
#include "changelog/ChangeLogFileWriter.h"
#include "common/Clock.h"
#include "common/Logging.h"
#include "common/Uuid.h"
#include "platform/bus/DistributedNotifications.h"
#include "platform/dav/TesselSession.h"
#include "platform/engine/SyncEngine.h"
#include "platform/fs/LocalPaths.h"

namespace {

constexpr const char* kUploadTrace = "Failed to upload changelog to temporary file";
constexpr auto kStaleAge = std::chrono::hours(24);

std::string temporaryPathFor(const std::string& finalPath) {
  return vtc::format("%@.%@.tmp", finalPath, vtc::makeUUIDString());
}

std::string versionText(int64_t index) {
  return vtc::format("%05i", static_cast<int32_t>(index));
}

}  // namespace

bool NubiloRemoteSession::commitChanges(const std::vector<SyncEngineChange>& changes,
                                        const std::string& dataclass, int64_t index, bool reset) {
  if (changes.empty()) return false;
  vtc::bus::postDistributedNotification(NubiloSyncProgressNotification, dataclass);

  const std::string finalPath = changeLogPathForDataclass(dataclass, index);
  std::string temporaryPath = temporaryPathFor(finalPath);

  // Written record by record into a file and sent from there: memory
  // follows one record, not the whole changelog.
  const std::string folder = vtc::paths::temporaryDirectory();
  const std::string localPath =
      vtc::paths::join(folder, ".changelog-" + vtc::makeUUIDString() + ".gz");
  struct RemoveWhenDone {
    const std::string& path;
    ~RemoveWhenDone() { ::unlink(path.c_str()); }
  } removeWhenDone{localPath};
  {
    vtc::clog::ChangeLogFileWriter changeLog(folder);
    changeLog.setHeaderValue(_configuration.get("guid"), "CreatorClientGuid");
    changeLog.setHeaderValue(_configuration.get("ClientName"), "CreatorClientName");
    changeLog.setHeaderValue(
        vtc::Value(vtc::format("%ld", static_cast<long>(VantorSyncManagerVersionNumber))),
        "CreatorClientVersion");
    changeLog.setSchemaVersions(vtc::engine::SyncEngine::open()->schemaVersions(dataclass));
    for (const SyncEngineChange& change : changes) changeLog.append(change);
    changeLog.finish(localPath);
  }
  VTC_LOG_INFO("%@ Uploading changeLog with index %d", dataclass, index);

  DavTransaction upload = _TesselSession->putLocalFileAtPath(localPath, temporaryPath);
  if (upload.errorType() == kNBTimeoutError) {
    temporaryPath = temporaryPathFor(finalPath);
    messageTraceTransactionFailure(upload, false, 0, kUploadTrace);
    VTC_LOG_INFO(
        "%@ Upload of changeLog with index %d failed due to timeout retrying with new tmp path "
        "%@...",
        dataclass, index, temporaryPath);
    upload = _TesselSession->putLocalFileAtPath(localPath, temporaryPath);
  }
  if (!upload.isSuccessful()) {
    VTC_LOG_ERROR("Failed to upload change log to path %@", finalPath);
    messageTraceTransactionFailure(upload, true, 0, kUploadTrace);
    if (upload.errorType() == kNBInsufficientStorage)
      throw NubiloException(
          NubiloTesselFullException,
          vtc::format("Insufficient storage available to upload to path %@", finalPath));
    if (upload.errorType() == kNBNetworkError)
      throw NubiloException(
          NubiloNetworkFailureException,
          vtc::format("Upload transaction failed due to network error, %@", upload));
    throw NubiloException(NubiloTransactionFailureException,
                          vtc::format("Upload transaction failed %@", upload));
  }

  // Published before the file is in place: a crash from here on leaves a
  // record that validPropertiesForDataclass reports and the next commit at
  // this index repairs. Not tested: the move below is the commit's guard.
  vtc::Dictionary record{{"maxversion", versionText(index)}};
  if (reset) {
    record.set("minversion", vtc::Value(versionText(index)));
    record.set("status", vtc::Value("normal"));
  }
  record.set("lastsync", vtc::Value(vtc::textOf(vtc::Value(vtc::currentClock().now()))));
  setInfoForDataclass(record, dataclass);

  DavTransaction move = moveResourceWithRetryAtPath(temporaryPath, finalPath, false);
  if (move.isSuccessful()) return true;

  if (move.httpStatusCode() == 412) {
    DavTransaction attributes = _TesselSession->basicAttributesAtPath(finalPath);
    if (attributes.isSuccessful()) {
      const vtc::Value& modified = attributes.result().dictionary().get(kNBLastModified);
      VTC_LOG_WARNING("Last modified date for %@ is %@", finalPath, modified);
      if (modified.kind() == vtc::Value::Kind::Date &&
          vtc::currentClock().now() - modified.date() > kStaleAge) {
        VTC_LOG_WARNING(
            "Last Modified date more than 1 day ago which likely indicates a stale changelog, "
            "overwriting...");
        move = moveResourceWithRetryAtPath(temporaryPath, finalPath);
        if (move.isSuccessful()) return true;
      }
    }
  }

  VTC_LOG_ERROR(
      "Failed to move change log at path %@ to path %@ with transaction %@, attempting to rollback",
      temporaryPath, finalPath, move);
  _TesselSession->deleteResourceAtPath(temporaryPath);  // a leftover is harmless: never read
  if (reset) {
    setInfoForDataclass(
        vtc::Dictionary{{"minversion", kNBRemoveProp}, {"maxversion", kNBRemoveProp}}, dataclass);
  } else if (move.httpStatusCode() != 412) {
    setInfoForDataclass(vtc::Dictionary{{"maxversion", versionText(index - 1)}}, dataclass);
  }
  // A 412 without reset leaves the record alone: the changelog at this
  // index is the winner's, and the record already names it.

  if (move.httpStatusCode() == 412)
    throw NubiloException(NubiloServerIncoherencyException,
                          "Failed to move changelog into place to do incoherency");
  throw NubiloException(
      NubiloTransactionFailureException,
      vtc::format("Failed to move changelog from %@ to %@", temporaryPath, finalPath));
}
