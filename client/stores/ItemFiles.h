// File-level helpers of the vdir store: descriptors that close themselves,
// whole-file reads and writes, and an item file's state from its stat.
#pragma once

#include <sys/stat.h>

#include <optional>
#include <string>
#include <string_view>

#include "client/stores/VdirCollection.h"

namespace vtc::client {

// A file descriptor, closed when the object goes (-1: none).
class FileDescriptor {
 public:
  explicit FileDescriptor(int fd = -1) : fd_(fd) {}
  FileDescriptor(const FileDescriptor&) = delete;
  FileDescriptor& operator=(const FileDescriptor&) = delete;
  ~FileDescriptor();

  int get() const { return fd_; }
  bool valid() const { return fd_ >= 0; }
  // Closes now; false when close reports an error (for written files).
  bool close();

 private:
  int fd_;
};

// Size, times and inode of a stat; no fields.
ItemState fileState(const struct stat& st);

// Whether a folder entry is an item file of this kind: the kind's extension,
// not hidden (temporary files of writes start with '.').
bool isItemFileName(std::string_view name, ItemKind kind);

// A fresh name for the temporary file of a write (".<uuid>.tmp"), and
// whether a folder entry bears such a name.
std::string newTemporaryName();
bool isTemporaryName(std::string_view name);

// The bytes of an open file, read to its end; none on a read error.
std::optional<std::string> readWhole(int fd);

// Writes all bytes; false on any error (errno says which).
bool writeWhole(int fd, std::string_view bytes);

// Renames `temporary` to `name` in the folder unless a file of that name
// exists, atomically; false with errno EEXIST when one does, and then both
// files are as they were.
bool placeNewFile(int dirFd, const std::string& temporary, const std::string& name);

}  // namespace vtc::client
