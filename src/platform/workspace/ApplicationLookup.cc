#include "platform/workspace/ApplicationLookup.h"

#include <sys/stat.h>

#include <cstdlib>
#include <sstream>
#include <string>

#include "platform/fs/LocalPaths.h"

namespace vtc::workspace {

bool applicationInstalled(std::string_view bundleName) {
  std::string id(bundleName);
  if (id.ends_with(".app")) id.resize(id.size() - 4);
  std::string dirs = paths::applicationSupportDirectory();
  const char* system = std::getenv("XDG_DATA_DIRS");
  dirs += ":";
  dirs += (system && *system) ? system : "/usr/local/share:/usr/share";
  std::stringstream list(dirs);
  for (std::string dir; std::getline(list, dir, ':');) {
    if (dir.empty()) continue;
    std::string entry = paths::join(paths::join(dir, "applications"), id + ".desktop");
    struct stat st {};
    if (::stat(entry.c_str(), &st) == 0 && S_ISREG(st.st_mode)) return true;
  }
  return false;
}

}  // namespace vtc::workspace
