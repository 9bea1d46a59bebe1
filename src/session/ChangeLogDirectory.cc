// Changelogs between the share and a local directory, the plain upload, and
// taking back the newest commit.
#include <algorithm>
#include <chrono>
#include <filesystem>
#include <fstream>

#include "VantorSyncManager/NubiloRemoteSession.h"
#include "VantorSyncManager/PublicNames.h"
#include "VantorSyncManager/StringAdditions.h"
#include "common/Clock.h"
#include "common/Logging.h"
#include "platform/dav/TesselSession.h"
#include "platform/fs/LocalPaths.h"

namespace {

// The running minimum before any version is known.
constexpr int64_t kNoMinimum = 0x7FFFFFFFFFFFFFFE;

std::string versionText(int64_t index) {
  return vtc::format("%05i", static_cast<int32_t>(index));
}

}  // namespace

void NubiloRemoteSession::uploadChangeLog(const vtc::Bytes& data, const std::string& dataclass,
                                          int64_t index) {
  _TesselSession->putData(data, changeLogPathForDataclass(dataclass, index));
}

void NubiloRemoteSession::downloadChangeLogsForDataclass(const std::string& dataclass,
                                                         const std::string& directory) {
  vtc::Dictionary record = getDataclassInfo(dataclass);
  const vtc::Value* min = record.find("minversion");
  const vtc::Value* max = record.find("maxversion");
  if (!min || !max) return;
  const std::string folder = vtc::paths::join(directory, dataclass);
  std::error_code ignored;  // a folder that cannot be made shows up as failed writes, also ignored
  std::filesystem::create_directories(folder, ignored);
  for (int64_t index = min->integer(); index <= max->integer(); ++index) {
    vtc::Bytes bytes = fetchChangeLogForDataclass(dataclass, index);
    // A copy for inspection: a file that cannot be written is skipped.
    std::ofstream(vtc::paths::join(folder, versionText(index) + ".clog"), std::ios::binary)
        .write(reinterpret_cast<const char*>(bytes.data()),
               static_cast<std::streamsize>(bytes.size()));
  }
}

void NubiloRemoteSession::putChangeLogsFromDirectory(const std::string& directory,
                                                     const std::string& dataclass,
                                                     const std::string& status, bool clear) {
  std::vector<std::filesystem::path> files;
  std::error_code error;
  for (auto it = std::filesystem::recursive_directory_iterator(directory, error);
       !error && it != std::filesystem::recursive_directory_iterator(); it.increment(error))
    files.push_back(std::filesystem::relative(it->path(), directory));
  std::sort(files.begin(), files.end());

  registerDataclass(dataclass);
  lockDataclass(dataclass);
  const auto halfLock = std::chrono::duration_cast<vtc::Date::duration>(
      std::chrono::duration<double>(_lockDuration / 2.0));
  vtc::Date renewBy = vtc::currentClock().now() + halfLock;

  int64_t minimum = kNoMinimum;
  int64_t maximum = 0;
  if (clear) {
    VTC_LOG_INFO("Clearing changelogs for dataclass: %@", dataclass);
    resetDataclass(dataclass);
  } else {
    // Both start from minversion: uploads widen the range from there.
    vtc::Dictionary record = getDataclassInfo(dataclass);
    if (const vtc::Value* min = record.find("minversion")) {
      minimum = min->integer();
      maximum = min->integer();
    }
  }
  lockClients();

  const std::string collection = dataclassPath(dataclass);
  for (const std::filesystem::path& relative : files) {
    if (renewBy < vtc::currentClock().now()) {
      relockDataclass(dataclass);
      relockClients();
      renewBy = vtc::currentClock().now() + halfLock;
    }
    if (relative.extension() != ".clog") continue;
    VTC_LOG_INFO("Uploading clog %@", relative.string());
    // Not tested: the record below names what was meant to be there, and a
    // missing file shows up as an invalid record.
    _TesselSession->putLocalFileAtPath(
        (std::filesystem::path(directory) / relative).string(),
        stringByAppendingTesselPathComponent(collection, relative.filename().string()));
    const int64_t index = vtc::Value(relative.stem().string()).integer();
    minimum = std::min(minimum, index);
    maximum = std::max(maximum, index);
  }
  if (minimum <= maximum)
    setInfoForDataclass(
        vtc::Dictionary{{"minversion", versionText(minimum)}, {"maxversion", versionText(maximum)}},
        dataclass);
  setAllClientStatus(status, dataclass);
  unlockClients();
  unlockDataclass(dataclass);
}

bool NubiloRemoteSession::removeLastChangelogForDataclass(const std::string& dataclass) {
  vtc::Dictionary record = getDataclassInfo(dataclass);
  const vtc::Value* max = record.find("maxversion");
  if (!max) return false;
  const int64_t last = max->integer();
  lockDataclass(dataclass);
  _TesselSession->deleteResourceAtPath(changeLogPathForDataclass(dataclass, last));
  setInfoForDataclass(
      vtc::Dictionary{{"maxversion", versionText(last - 1)}, {"status", kNBRemoveProp}}, dataclass);
  unlockDataclass(dataclass);
  lockClients();
  setAllClientStatus("needstruth", dataclass);
  unlockClients();
  return true;
}
