// Crash flags: absent, then empty when a decode starts, then 8 bytes when a
// second starts before the first finished; a third start is refused.
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include "VantorSyncManager/NubiloChangeLog.h"
#include "VantorSyncManager/NubiloException.h"
#include "VantorSyncManager/PublicNames.h"
#include "VantorSyncManager/VTCPrefsCenter.h"
#include "changelog/ChangeLogFormat.h"
#include "common/Format.h"
#include "platform/fs/LocalPaths.h"

namespace vtc::clog {

uint64_t stableHash(ByteView bytes) { return stableHash(bytes, kHashSeed); }

uint64_t stableHash(ByteView bytes, uint64_t carried) {
  uint64_t h = carried;
  for (uint8_t b : bytes) {
    h ^= b;
    h *= 1099511628211ull;
  }
  return h;
}

std::string crashFlagPath(uint64_t hash) {
  std::string folder = VTCPrefsCenter::applicationSupportDirectory().value_or(
      paths::join(paths::applicationSupportDirectory(), "NubiloSyncClient"));
  return paths::join(folder, format("%lu.cflag", static_cast<unsigned long>(hash)));
}

}  // namespace vtc::clog

// Failures to create, write or delete a flag are not reported: the flag is
// a safety net, and a decode goes on without it.
void NubiloChangeLog::setCrashFlagForHash(uint64_t hash) {
  std::string path = vtc::clog::crashFlagPath(hash);
  struct stat st {};
  if (::stat(path.c_str(), &st) != 0) {
    int fd = ::open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0666);
    if (fd >= 0) ::close(fd);
    return;
  }
  if (st.st_size == 0) {
    int fd = ::open(path.c_str(), O_WRONLY | O_CLOEXEC);
    if (fd >= 0) {
      const uint64_t one = 1;
      (void)!::write(fd, &one, sizeof one);
      ::close(fd);
    }
    return;
  }
  if (::unlink(path.c_str()) != 0) return;
  throw NubiloException(
      NubiloCorruptChangelogException,
      vtc::format("crash file for changelog hash of %lu exists treating as corrupt changelog",
                  static_cast<unsigned long>(hash)));
}

void NubiloChangeLog::clearCrashFlagForHash(uint64_t hash) {
  ::unlink(vtc::clog::crashFlagPath(hash).c_str());  // a missing flag is no error
}
