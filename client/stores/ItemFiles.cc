#include "client/stores/ItemFiles.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cctype>
#include <cerrno>
#include <cstdio>

#include "common/Uuid.h"

namespace vtc::client {

FileDescriptor::~FileDescriptor() {
  close();  // a failure here concerns only files already read or given up
}

bool FileDescriptor::close() {
  if (fd_ < 0) return true;
  int fd = fd_;
  fd_ = -1;
  return ::close(fd) == 0;
}

ItemState fileState(const struct stat& st) {
  constexpr int64_t kBillion = 1000000000;
  ItemState state;
  state.size = st.st_size;
  state.modifiedNanoseconds = st.st_mtim.tv_sec * kBillion + st.st_mtim.tv_nsec;
  state.changedNanoseconds = st.st_ctim.tv_sec * kBillion + st.st_ctim.tv_nsec;
  state.inode = st.st_ino;
  return state;
}

bool isItemFileName(std::string_view name, ItemKind kind) {
  std::string_view extension = itemExtension(kind);
  return !name.starts_with('.') && name.size() > extension.size() && name.ends_with(extension);
}

namespace {

constexpr std::string_view kTemporaryEnd = ".tmp";
constexpr size_t kUuidLength = 36;  // 8-4-4-4-12 hexadecimal digits

}  // namespace

std::string newTemporaryName() {
  return "." + makeUUIDString() + std::string(kTemporaryEnd);
}

bool isTemporaryName(std::string_view name) {
  if (name.size() != 1 + kUuidLength + kTemporaryEnd.size() || !name.starts_with('.') ||
      !name.ends_with(kTemporaryEnd))
    return false;
  const std::string_view uuid = name.substr(1, kUuidLength);
  for (size_t i = 0; i < uuid.size(); ++i) {
    const bool dash = i == 8 || i == 13 || i == 18 || i == 23;
    if (dash ? uuid[i] != '-' : !std::isxdigit(static_cast<unsigned char>(uuid[i]))) return false;
  }
  return true;
}

std::optional<std::string> readWhole(int fd) {
  std::string bytes;
  // Sized once from the file's length: a grown string holds up to twice it.
  struct stat st {};
  if (::fstat(fd, &st) == 0 && st.st_size > 0) bytes.reserve(static_cast<size_t>(st.st_size));
  char buffer[16384];
  for (;;) {
    ssize_t n = ::read(fd, buffer, sizeof buffer);
    if (n == 0) return bytes;
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) return std::nullopt;
    bytes.append(buffer, static_cast<size_t>(n));
  }
}

bool writeWhole(int fd, std::string_view bytes) {
  while (!bytes.empty()) {
    ssize_t n = ::write(fd, bytes.data(), bytes.size());
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return false;
    bytes.remove_prefix(static_cast<size_t>(n));
  }
  return true;
}

bool placeNewFile(int dirFd, const std::string& temporary, const std::string& name) {
  if (::renameat2(dirFd, temporary.c_str(), dirFd, name.c_str(), RENAME_NOREPLACE) == 0)
    return true;
  if (errno != EINVAL && errno != ENOSYS) return false;
  // The file system cannot rename without replacing; a hard link does the same.
  if (::linkat(dirFd, temporary.c_str(), dirFd, name.c_str(), 0) != 0) return false;
  ::unlinkat(dirFd, temporary.c_str(), 0);  // a leftover is hidden and never read
  return true;
}

}  // namespace vtc::client
