// Downloading changelogs: ranges in growing batches, and single ones. Each
// changelog is downloaded into a file of the temporary folder (so a large
// one never sits whole in memory, and one larger than the limits allow is
// given up while it arrives); only one batch of downloads is held at a time,
// and the WebDAV session's monitor is held for a batch's downloads only,
// never while parsing.
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <fstream>
#include <iterator>
#include <mutex>
#include <optional>

#include "VantorSyncManager/NubiloDataAdditions.h"
#include "VantorSyncManager/NubiloException.h"
#include "VantorSyncManager/NubiloRemoteSession.h"
#include "VantorSyncManager/PublicNames.h"
#include "changelog/ChangeLogEnvelope.h"
#include "common/Logging.h"
#include "common/Uuid.h"
#include "platform/bus/DistributedNotifications.h"
#include "platform/dav/TesselSession.h"
#include "platform/fs/LocalPaths.h"
#include "platform/sealing/AccountSeal.h"

namespace {

constexpr int64_t kFirstBatchSize = 4;
constexpr int64_t kLargestBatchSize = 256;
// From this size on a changelog is kept in a mapped file, not in memory.
constexpr size_t kMappingThreshold = 32768;

constexpr const char* kDownloadFailure =
    "Failed to download changelog for dataclass %@ with index %d transaction %@";
constexpr const char* kEmptyChangelog =
    "Empty changelog found for dataclass %@ with index %d transaction %@";

// A downloaded changelog's file, removed unless a mapped changelog adopts it.
struct Download {
  int64_t index;
  std::string file;
  Download(int64_t i, std::string f) : index(i), file(std::move(f)) {}
  Download(Download&& other) noexcept : index(other.index), file(std::move(other.file)) {
    other.file.clear();
  }
  Download(const Download&) = delete;
  ~Download() {
    if (!file.empty()) ::unlink(file.c_str());
  }
  std::string release() { return std::exchange(file, std::string()); }
};

std::string downloadFile() {
  return vtc::paths::join(vtc::paths::temporaryDirectory(), vtc::makeUUIDString() + ".clog");
}

uint64_t fileSize(const std::string& path) {
  struct stat st {};
  return ::stat(path.c_str(), &st) == 0 ? static_cast<uint64_t>(st.st_size) : 0;
}

vtc::Bytes readWhole(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  return vtc::Bytes(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
}
// The envelope's headers when the file is an encrypted account's changelog
// (read from its first bytes only).
std::optional<vtc::Dictionary> envelopeHeadersOf(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  vtc::Bytes head(4096);
  in.read(reinterpret_cast<char*>(head.data()), static_cast<std::streamsize>(head.size()));
  head.resize(static_cast<size_t>(in.gcount()));
  auto envelope = vtc::clog::readEnvelope(head);
  if (!envelope) return std::nullopt;
  return std::move(envelope->headers);
}

// Opens one downloaded changelog of an encrypted account into result, or
// refuses it there. It is opened from file to file, a piece at a time.
void openSealed(const vtc::sealing::AccountSeal& seal, const Download& download,
                const std::string& dataclass, vtc::ChangeLogFetchResult& result) {
  Download plain(download.index, downloadFile());
  try {
    std::ifstream stored(download.file, std::ios::binary);
    std::ofstream out(plain.file, std::ios::binary | std::ios::trunc);
    seal.openChangeLog(stored, out, dataclass, download.index);
    out.close();
    if (!out) throw std::runtime_error("it could not be written whole here");
  } catch (const std::runtime_error& e) {
    // Never applied, never a stop: the caller names it and goes on.
    std::string creator;
    if (auto headers = envelopeHeadersOf(download.file))
      creator = headers->get("CreatorClientGuid").string();
    VTC_LOG_WARNING("Changelog %d of %@ is set aside: %@", download.index, dataclass, e.what());
    result.refusedChangeLogs[download.index] = vtc::RefusedChangeLog{e.what(), creator};
    return;
  }
  // Read like a plain changelog of its size (the files go with the
  // changelog or the download).
  if (fileSize(plain.file) < kMappingThreshold)
    result.changeLogs[download.index] = std::make_unique<NubiloChangeLog>(readWhole(plain.file));
  else
    result.changeLogs[download.index] = NubiloMappedChangelog::adoptingFile(plain.release());
}

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
    std::vector<Download> batch;
    {
      std::lock_guard<std::recursive_mutex> monitor(_TesselSession->monitor());
      for (int64_t index = start; index <= end; ++index) {
        if (_isCancelled) break;
        Download download(index, downloadFile());
        DavTransaction t =
            getDataWithRetryAtPath(changeLogPathForDataclass(dataclass, index), download.file);
        if (t.isSuccessful()) {
          const uint64_t bytes = fileSize(download.file);
          // Taken for a changelog, no bytes would decode as no changes.
          if (bytes == 0)
            throw NubiloException(NubiloCorruptChangelogException,
                                  vtc::format(kEmptyChangelog, dataclass, index, t));
          VTC_LOG_INFO("Downloaded changelog %d (%d bytes) of %d for dataclass %@", index, bytes,
                       to, dataclass);
          result.StorageConsumed += static_cast<int64_t>(bytes);
          batch.push_back(std::move(download));
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
            throw NubiloException(NubiloCorruptChangelogException,
                                  vtc::format(kEmptyChangelog, dataclass, index, t));
        }
        throw NubiloException(NubiloFailedToDownloadChangelogException,
                              vtc::format(kDownloadFailure, dataclass, index, t));
      }
    }
    VTC_LOG_INFO("Processing batched clogs from %i to %i for %@", start, end, dataclass);
    for (Download& download : batch) {
      if (_accountSeal) {
        openSealed(*_accountSeal, download, dataclass, result);
        continue;
      }
      // An encrypted account's changelog read without its key would be a
      // changelog without changes: it is refused instead.
      if (envelopeHeadersOf(download.file)) {
        VTC_LOG_WARNING("Changelog %d of %@ is encrypted and this session has no key",
                        download.index, dataclass);
        result.refusedChangeLogs[download.index] = vtc::RefusedChangeLog{
            "it is encrypted, and this computer has not the account's key", ""};
        continue;
      }
      if (fileSize(download.file) < kMappingThreshold)
        result.changeLogs[download.index] = std::make_unique<NubiloChangeLog>(
            readWhole(download.file));  // the file goes with the download
      else
        result.changeLogs[download.index] = NubiloMappedChangelog::adoptingFile(download.release());
    }
    size = size < kLargestBatchSize ? size * 2 : kLargestBatchSize;
    start = end + 1;
  }
  return result;
}

vtc::Bytes NubiloRemoteSession::fetchChangeLogForDataclass(const std::string& dataclass,
                                                           int64_t index) {
  Download download(index, downloadFile());
  DavTransaction t =
      getDataWithRetryAtPath(changeLogPathForDataclass(dataclass, index), download.file);
  if (!t.isSuccessful()) {
    messageTraceTransactionFailure(t, true, 0, "Failed download changelog");
    throw NubiloException(NubiloFailedToDownloadChangelogException,
                          vtc::format(kDownloadFailure, dataclass, index, t));
  }
  vtc::Bytes bytes = readWhole(download.file);
  if (bytes.empty())
    throw NubiloException(NubiloCorruptChangelogException,
                          vtc::format(kEmptyChangelog, dataclass, index, t));
  return bytes;
}
