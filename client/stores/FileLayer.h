// The file operations of the vdir store, in one place, so that a test can
// watch them, fail them, or undo what a power cut would have undone. The
// base class is the system's calls; a test derives from it, and calls the
// base for what it lets through.
//
// Each operation returns what its system call returns, with errno set on
// failure (-1, false or none). Names are relative to an open folder, or a
// whole path with AT_FDCWD. A file's bytes are durable once syncFile() or
// syncFileSystem() has returned after they were written; a folder's
// entries (created, renamed, removed) once syncFolder() or
// syncFileSystem() has.
#pragma once

#include <sys/stat.h>

#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace vtc::client {

class FileLayer {
 public:
  virtual ~FileLayer() = default;

  // A descriptor of the folder, for the operations below; the caller closes it.
  virtual int openFolder(const std::string& path);
  // The names of every entry of the folder but "." and ".."; false when the
  // listing fails, also halfway (names is then incomplete).
  virtual bool list(int folder, std::vector<std::string>& names);
  virtual int stat(int folder, const std::string& name, struct stat* st);
  // A whole file's bytes; *st is the state of the file that was read.
  virtual std::optional<std::string> read(int folder, const std::string& name, struct stat* st);

  // A new file, open for writing (fails with EEXIST where one exists).
  virtual int createTemporary(int folder, const std::string& name, mode_t mode);
  virtual bool write(int file, std::string_view bytes);
  virtual int syncFile(int file);
  // Replaces `to` where it exists.
  virtual int rename(int folder, const std::string& from, const std::string& to);
  // Fails with EEXIST, and changes nothing, where `to` exists.
  virtual int renameNoReplace(int folder, const std::string& from, const std::string& to);
  virtual int unlink(int folder, const std::string& name);
  virtual int syncFolder(int folder);
  // Everything written on the folder's file system, in one call.
  virtual int syncFileSystem(int folder);
};

// The layer the vdir store uses: the system's unless a test installed one.
FileLayer& currentFileLayer();
// Installs a layer for the whole process; nullptr restores the system's.
// The caller keeps ownership and must outlive its use.
void installFileLayer(FileLayer* layer);

}  // namespace vtc::client
