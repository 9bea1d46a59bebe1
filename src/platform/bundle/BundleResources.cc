#include "platform/bundle/BundleResources.h"

#include <dlfcn.h>
#include <unistd.h>

#include <filesystem>
#include <vector>

namespace vtc::bundle {

namespace {

// The folder of the loaded library (or of the program it is linked into).
std::filesystem::path loadedFolder() {
  Dl_info info{};
  if (::dladdr(reinterpret_cast<const void*>(&pathForResource), &info) == 0 || !info.dli_fname)
    return {};
  std::error_code error;
  auto path = std::filesystem::canonical(info.dli_fname, error);
  return error ? std::filesystem::path() : path.parent_path();
}

}  // namespace

std::optional<std::string> pathForResource(const std::string& name, const std::string& type) {
  const std::string file = name + "." + type;
  std::vector<std::filesystem::path> candidates;
  const std::filesystem::path folder = loadedFolder();
  if (!folder.empty()) {
    // <prefix>/lib/<multiarch>/libX.so and <prefix>/lib/libX.so, <prefix>/bin/program
    candidates.push_back(folder.parent_path() / "share" / "VantorSyncManager" / file);
    candidates.push_back(folder.parent_path().parent_path() / "share" / "VantorSyncManager" / file);
  }
#ifdef VSM_SOURCE_RESOURCES
  candidates.push_back(std::filesystem::path(VSM_SOURCE_RESOURCES) / file);
#endif
  std::error_code error;
  for (const auto& candidate : candidates)
    if (std::filesystem::is_regular_file(candidate, error)) return candidate.string();
  return std::nullopt;
}

std::optional<std::string> pathForTool(const std::string& name) {
  std::vector<std::filesystem::path> candidates;
  const std::filesystem::path folder = loadedFolder();
  if (!folder.empty()) {
    // <prefix>/bin/program, <prefix>/lib/libX.so, <prefix>/lib/<multiarch>/libX.so
    candidates.push_back(folder / name);
    candidates.push_back(folder.parent_path() / "bin" / name);
    candidates.push_back(folder.parent_path().parent_path() / "bin" / name);
  }
#ifdef VSM_BUILD_PROGRAMS
  candidates.push_back(std::filesystem::path(VSM_BUILD_PROGRAMS) / name / name);
#endif
  std::error_code error;
  for (const auto& candidate : candidates)
    if (std::filesystem::is_regular_file(candidate, error) &&
        ::access(candidate.c_str(), X_OK) == 0)
      return candidate.string();
  return std::nullopt;
}

}  // namespace vtc::bundle
