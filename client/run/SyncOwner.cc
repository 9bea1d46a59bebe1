#include "client/run/SyncOwner.h"

#include <fcntl.h>
#include <sys/file.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <string>

#include "VantorSyncManager/VTCPrefsCenter.h"
#include "client/run/SyncFailure.h"
#include "platform/fs/LocalPaths.h"

namespace vtc::client {

std::unique_ptr<SyncOwner> SyncOwner::acquire() {
  auto folder = VTCPrefsCenter::applicationSupportDirectory();
  if (!folder) throw SyncFailure(FailureKind::Other, "The support folder cannot be created.");
  const std::string path = paths::join(*folder, ".owner.pid");
  int fd = ::open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0644);
  if (fd < 0)
    throw SyncFailure(FailureKind::Other, "Cannot open " + path + ": " + std::strerror(errno));
  if (::flock(fd, LOCK_EX | LOCK_NB) != 0) {
    char text[32] = {};
    (void)!::pread(fd, text, sizeof text - 1, 0);
    ::close(fd);
    const long pid = std::strtol(text, nullptr, 10);
    throw SyncFailure(FailureKind::Busy, pid > 0
                                             ? "Another sync is running (process " +
                                                   std::to_string(pid) + "); wait for it to finish."
                                             : "Another sync is running; wait for it to finish.");
  }
  const std::string pid = std::to_string(::getpid()) + "\n";
  if (::ftruncate(fd, 0) != 0 || ::pwrite(fd, pid.data(), pid.size(), 0) < 0) {
    ::close(fd);
    throw SyncFailure(FailureKind::Other, "Cannot write " + path + ": " + std::strerror(errno));
  }
  return std::unique_ptr<SyncOwner>(new SyncOwner(fd));
}

SyncOwner::~SyncOwner() {
  // An empty file names no process; a crash leaves a number whose process
  // has ended, which reads as not running either.
  (void)!::ftruncate(fd_, 0);
  ::close(fd_);
}

}  // namespace vtc::client
