// VTCPrefsCenter: dataclasses queued for the next sync, one empty file each
// in the caches folder.
#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>

#include "VantorSyncManager/VTCPrefsCenter.h"
#include "common/Logging.h"
#include "platform/fs/LocalPaths.h"
#include "prefs/PrefsKeys.h"

namespace {

std::string queueFolder() {
  return vtc::paths::join(vtc::paths::cachesDirectory(), vtc::prefkeys::kQueueFolder);
}

}  // namespace

bool VTCPrefsCenter::queueDataclasses(const std::vector<std::string>& dataclasses) {
  if (dataclasses.empty()) return true;
  std::string folder = queueFolder();
  vtc::paths::makeDirectories(folder);  // a failure shows in the opens below, which are logged
  VTC_LOG_INFO("Queuing dataclasses %@ for next sync", dataclasses);
  for (const std::string& name : dataclasses) {
    std::string file = vtc::paths::join(folder, name);
    int fd = ::open(file.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0666);
    if (fd >= 0)
      ::close(fd);
    else
      VTC_LOG_WARNING("Could not queue dataclass %@ at %@", name, file);
  }
  return true;
}

std::optional<std::vector<std::string>> VTCPrefsCenter::getQueuedDataclasses(bool clear) {
  std::error_code error;
  std::filesystem::directory_iterator it(queueFolder(), error);
  if (error) return std::nullopt;
  std::vector<std::string> names;
  for (const auto& entry : it) names.push_back(entry.path().filename().string());
  std::sort(names.begin(), names.end());
  if (clear) {
    for (const std::string& name : names) {
      std::error_code ignored;  // a file that is already gone is no longer queued either
      std::filesystem::remove(vtc::paths::join(queueFolder(), name), ignored);
    }
  }
  return names;
}
