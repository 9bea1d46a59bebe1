#include "platform/workspace/ApplicationLookup.h"

#include <sys/stat.h>

#include <cstdlib>
#include <fstream>
#include <sstream>
#include <string>

#include "platform/fs/LocalPaths.h"

namespace vtc::workspace {

namespace {

// The desktop entry "<id>.desktop" found first in the XDG applications
// folders (the user's before the system's), or an empty path.
std::string desktopEntry(const std::string& id) {
  std::string dirs = paths::applicationSupportDirectory();
  const char* system = std::getenv("XDG_DATA_DIRS");
  dirs += ":";
  dirs += (system && *system) ? system : "/usr/local/share:/usr/share";
  std::stringstream list(dirs);
  for (std::string dir; std::getline(list, dir, ':');) {
    if (dir.empty()) continue;
    std::string entry = paths::join(paths::join(dir, "applications"), id + ".desktop");
    struct stat st {};
    if (::stat(entry.c_str(), &st) == 0 && S_ISREG(st.st_mode)) return entry;
  }
  return {};
}

}  // namespace

bool applicationInstalled(std::string_view bundleName) {
  std::string id(bundleName);
  if (id.ends_with(".app")) id.resize(id.size() - 4);
  return !desktopEntry(id).empty();
}

std::optional<std::string> applicationPath(std::string_view bundleIdentifier) {
  const std::string entry = desktopEntry(std::string(bundleIdentifier));
  if (entry.empty()) return std::nullopt;
  std::ifstream in(entry);
  bool inEntry = false;
  for (std::string line; std::getline(in, line);) {
    if (line.starts_with("[")) inEntry = line == "[Desktop Entry]";
    if (inEntry && line.starts_with("Path=") && line.size() > 5) return line.substr(5);
  }
  return std::nullopt;
}

}  // namespace vtc::workspace
