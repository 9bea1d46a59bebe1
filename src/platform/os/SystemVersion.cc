#include "platform/os/SystemVersion.h"

#include <fstream>
#include <mutex>

namespace vtc::os {

namespace {

std::mutex gMutex;
std::string gReleaseFile;

// The value of KEY=value or KEY="value" in the release file.
std::optional<std::string> releaseField(const std::string& key) {
  std::string path;
  {
    std::lock_guard<std::mutex> lock(gMutex);
    path = gReleaseFile.empty() ? "/etc/os-release" : gReleaseFile;
  }
  std::ifstream in(path);
  for (std::string line; std::getline(in, line);) {
    if (!line.starts_with(key + "=")) continue;
    std::string value = line.substr(key.size() + 1);
    if (value.size() >= 2 && (value.front() == '"' || value.front() == '\'') &&
        value.back() == value.front())
      value = value.substr(1, value.size() - 2);
    if (value.empty()) return std::nullopt;
    return value;
  }
  return std::nullopt;
}

}  // namespace

std::optional<std::string> productVersion() {
  return releaseField("VERSION_ID");
}
// Releases without a build identifier (Debian's) are named by their codename.
std::optional<std::string> buildVersion() {
  if (auto build = releaseField("BUILD_ID")) return build;
  return releaseField("VERSION_CODENAME");
}

void setReleaseFileForTesting(std::string path) {
  std::lock_guard<std::mutex> lock(gMutex);
  gReleaseFile = std::move(path);
}

}  // namespace vtc::os
