#include "client/stores/FileLayer.h"

#include <dirent.h>
#include <fcntl.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>

#include "client/stores/ItemFiles.h"

namespace vtc::client {

namespace {

FileLayer systemLayer;
std::atomic<FileLayer*> installed{nullptr};

}  // namespace

FileLayer& currentFileLayer() {
  FileLayer* layer = installed.load(std::memory_order_acquire);
  return layer ? *layer : systemLayer;
}

void installFileLayer(FileLayer* layer) {
  installed.store(layer, std::memory_order_release);
}

int FileLayer::openFolder(const std::string& path) {
  return ::open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
}

bool FileLayer::list(int folder, std::vector<std::string>& names) {
  // A descriptor of its own: closedir closes it, and the folder's keeps its place.
  const int own = ::dup(folder);
  DIR* dir = own >= 0 ? ::fdopendir(own) : nullptr;
  if (!dir) {
    if (own >= 0) ::close(own);
    return false;
  }
  ::rewinddir(dir);
  bool complete = true;
  for (;;) {
    errno = 0;
    const dirent* entry = ::readdir(dir);
    if (!entry) {
      complete = errno == 0;
      break;
    }
    const std::string_view name = entry->d_name;
    if (name != "." && name != "..") names.emplace_back(name);
  }
  const int error = errno;
  ::closedir(dir);
  errno = error;
  return complete;
}

int FileLayer::stat(int folder, const std::string& name, struct stat* st) {
  return ::fstatat(folder, name.c_str(), st, 0);
}

std::optional<std::string> FileLayer::read(int folder, const std::string& name, struct stat* st) {
  FileDescriptor file(::openat(folder, name.c_str(), O_RDONLY | O_CLOEXEC));
  if (!file.valid() || ::fstat(file.get(), st) != 0) return std::nullopt;
  return readWhole(file.get());
}

int FileLayer::createTemporary(int folder, const std::string& name, mode_t mode) {
  return ::openat(folder, name.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, mode);
}

bool FileLayer::write(int file, std::string_view bytes) {
  return writeWhole(file, bytes);
}

int FileLayer::syncFile(int file) {
  return ::fsync(file);
}

int FileLayer::rename(int folder, const std::string& from, const std::string& to) {
  return ::renameat(folder, from.c_str(), folder, to.c_str());
}

int FileLayer::renameNoReplace(int folder, const std::string& from, const std::string& to) {
  return placeNewFile(folder, from, to) ? 0 : -1;
}

int FileLayer::unlink(int folder, const std::string& name) {
  return ::unlinkat(folder, name.c_str(), 0);
}

int FileLayer::syncFolder(int folder) {
  return ::fsync(folder);
}

int FileLayer::syncFileSystem(int folder) {
  return ::syncfs(folder);
}

}  // namespace vtc::client
