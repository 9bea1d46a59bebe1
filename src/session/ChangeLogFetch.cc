// Downloading changelogs: ranges in growing batches, and single ones. Only
// one batch of unparsed bytes is held at a time, and the WebDAV session's
// monitor is held for a batch's downloads only, never while parsing.
#include <algorithm>
#include <mutex>

#include "VantorSyncManager/NubiloException.h"
#include "VantorSyncManager/NubiloRemoteSession.h"
#include "VantorSyncManager/PublicNames.h"
#include "common/Logging.h"
#include "platform/bus/DistributedNotifications.h"
#include "platform/dav/TesselSession.h"

namespace {

constexpr int64_t kFirstBatchSize = 4;
constexpr int64_t kLargestBatchSize = 256;
// From this size on a changelog is kept in a mapped file, not in memory.
constexpr size_t kMappingThreshold = 32768;

constexpr const char* kDownloadFailure =
    "Failed to download changelog for dataclass %@ with index %d transaction %@";

}  // namespace

vtc::ChangeLogFetchResult NubiloRemoteSession::fetchChangeLogsForDataclass(
    const std::string& dataclass, int64_t from, int64_t to) {
  vtc::ChangeLogFetchResult result;
  if (from < 0 || to < 0) return result;
  vtc::bus::postDistributedNotification(NubiloSyncProgressNotification, dataclass,
                                        vtc::Dictionary{{NubiloSyncProgressKey, 0}});

  int64_t size = kFirstBatchSize;
  for (int64_t start = from; start <= to;) {
    const int64_t end = std::min(start + size, to);
    std::vector<std::pair<int64_t, vtc::Value>> batch;  // bodies, as data values
    {
      std::lock_guard<std::recursive_mutex> monitor(_TesselSession->monitor());
      for (int64_t index = start; index <= end; ++index) {
        if (_isCancelled) break;
        DavTransaction t = getDataWithRetryAtPath(changeLogPathForDataclass(dataclass, index));
        if (t.isSuccessful()) {
          const vtc::Bytes& bytes = t.result().data();
          VTC_LOG_INFO("Downloaded changelog %d (%d bytes) of %d for dataclass %@", index,
                       bytes.size(), to, dataclass);
          result.StorageConsumed += static_cast<int64_t>(bytes.size());
          batch.emplace_back(index, t.takeResult());
          continue;
        }
        messageTraceTransactionFailure(t, true, 0, "Failed to get attributes on changelog");
        if (t.httpStatusCode() == 404 && index > from && index < to)
          throw NubiloException(
              NubiloCorruptChangelogException,
              vtc::format("failed to download changelog due to 404 error for dataclass %@ with "
                          "index %d transaction %@",
                          dataclass, index, t));
        if (t.httpStatusCode() == 200) {
          DavTransaction attributes =
              _TesselSession->basicAttributesAtPath(changeLogPathForDataclass(dataclass, index));
          if (attributes.isSuccessful() &&
              attributes.result().dictionary().get(kNBContentLength).integer() == 0)
            throw NubiloException(
                NubiloCorruptChangelogException,
                vtc::format("Empty changelog found for dataclass %@ with index %d transaction %@",
                            dataclass, index, t));
        }
        throw NubiloException(NubiloFailedToDownloadChangelogException,
                              vtc::format(kDownloadFailure, dataclass, index, t));
      }
    }
    VTC_LOG_INFO("Processing batched clogs from %i to %i for %@", start, end, dataclass);
    for (auto& [index, body] : batch) {
      result.changeLogs[index] =
          NubiloChangeLog::createChangeLogWithData(body.data(), kMappingThreshold);
      body = vtc::Value();  // each body goes as soon as it is parsed
    }
    size = size < kLargestBatchSize ? size * 2 : kLargestBatchSize;
    start = end + 1;
  }
  return result;
}

vtc::Bytes NubiloRemoteSession::fetchChangeLogForDataclass(const std::string& dataclass,
                                                           int64_t index) {
  DavTransaction t = getDataWithRetryAtPath(changeLogPathForDataclass(dataclass, index));
  if (!t.isSuccessful()) {
    messageTraceTransactionFailure(t, true, 0, "Failed download changelog");
    throw NubiloException(NubiloFailedToDownloadChangelogException,
                          vtc::format(kDownloadFailure, dataclass, index, t));
  }
  return t.result().data();
}
