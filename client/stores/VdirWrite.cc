// Writing and removing item files. A file is replaced by renaming a fully
// written and flushed temporary file over it, so that readers see the old
// bytes or the new ones, never a part; a new item's file is put in place
// only if no file of that name has appeared meanwhile. Before that, the
// file on disk is compared with what the caller last saw, and a file
// changed since is left alone: its change reaches the sync at the next
// scan. What remains is the instant between that check and the rename; no
// lock guards a vdir folder against the other programs that use it.
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <stdexcept>

#include "client/items/ItemText.h"
#include "client/stores/ItemFiles.h"
#include "client/stores/VdirCollection.h"
#include "common/Logging.h"
#include "platform/fs/LocalPaths.h"

namespace vtc::client {

namespace {

// New item files are private: they hold people's contacts and calendars.
constexpr mode_t kNewFileMode = 0600;

void requireItemName(const std::string& name, ItemKind kind) {
  if (!isItemFileName(name, kind) || name.find('/') != std::string::npos)
    throw std::invalid_argument(format("Not an item file name: %@", name));
}

// Gone: an expected file is absent. Unknown: stat failed (errno says why).
enum class OnDisk { AsExpected, Changed, Gone, Unknown };

// Whether the file `name` is still as `expected` says (none: absent); its
// permission bits go to *mode.
OnDisk compareWithDisk(FileLayer& files, int dirFd, const std::string& name,
                       const std::optional<ItemState>& expected, mode_t* mode = nullptr) {
  struct stat st {};
  if (files.stat(dirFd, name, &st) != 0) {
    if (errno != ENOENT) return OnDisk::Unknown;
    return expected ? OnDisk::Gone : OnDisk::AsExpected;
  }
  if (mode) *mode = st.st_mode & 07777;
  return expected && fileState(st).sameFileAs(*expected) ? OnDisk::AsExpected : OnDisk::Changed;
}

}  // namespace

WriteOutcome VdirCollection::write(const std::string& name, const std::string& bytes,
                                   const std::optional<ItemState>& expected,
                                   ItemState* state) const {
  requireItemName(name, kind_);
  std::string path = paths::join(folder_, name);
  std::string problem;
  if (!readItemText(kind_, bytes, &problem)) {
    VTC_LOG_ERROR("Not writing %@: the new bytes are not a valid item (%@)", path, problem);
    return WriteOutcome::Failed;
  }
  auto failed = [&](const char* step) {
    VTC_LOG_ERROR("Could not write %@ (%s): %s", path, step, strerror(errno));
    return WriteOutcome::Failed;
  };
  auto skipped = [&] {
    VTC_LOG_INFO("Not writing %@: it changed on disk since it was last read", path);
    return WriteOutcome::SkippedChangedOnDisk;
  };

  FileLayer& files = *files_;
  FileDescriptor dir(files.openFolder(folder_));
  if (!dir.valid()) return failed("opening the folder");
  mode_t mode = kNewFileMode;
  OnDisk before = compareWithDisk(files, dir.get(), name, expected, &mode);
  if (before == OnDisk::Unknown) return failed("examining the file");
  if (before != OnDisk::AsExpected) return skipped();

  const std::string temporary = newTemporaryName();
  FileDescriptor file(files.createTemporary(dir.get(), temporary, mode));
  if (!file.valid()) return failed("creating a temporary file");
  // The name is ours alone (created exclusively), so it can go on every way out.
  struct TemporaryName {
    FileLayer& files;
    int dirFd;
    const std::string& name;
    bool placed = false;
    ~TemporaryName() {
      if (!placed) files.unlink(dirFd, name);
    }
  } cleanup{files, dir.get(), temporary};

  if (::fchmod(file.get(), mode) != 0) return failed("setting the permissions");
  if (!files.write(file.get(), bytes)) return failed("writing");
  if (!deferFlushes_ && files.syncFile(file.get()) != 0) return failed("flushing");

  // Writing took time: look again, right before the rename.
  OnDisk now = compareWithDisk(files, dir.get(), name, expected);
  if (now == OnDisk::Unknown) return failed("examining the file");
  if (now != OnDisk::AsExpected) return skipped();
  if (expected) {
    if (files.rename(dir.get(), temporary, name) != 0) return failed("renaming");
  } else if (files.renameNoReplace(dir.get(), temporary, name) != 0) {
    if (errno == EEXIST) return skipped();
    return failed("renaming");
  }
  cleanup.placed = true;

  // The state after the rename, which sets the change time.
  struct stat st {};
  if (::fstat(file.get(), &st) != 0) return failed("reading its state");
  if (!file.close()) return failed("closing");
  // Until the folder is flushed, a crash can bring back the old file; the
  // caller must then not take the new state as written.
  if (!deferFlushes_ && files.syncFolder(dir.get()) != 0) return failed("flushing the folder");
  if (state) *state = fileState(st);
  return WriteOutcome::Written;
}

WriteOutcome VdirCollection::remove(const std::string& name, const ItemState& expected) const {
  requireItemName(name, kind_);
  std::string path = paths::join(folder_, name);
  auto failed = [&](const char* step) {
    VTC_LOG_ERROR("Could not remove %@ (%s): %s", path, step, strerror(errno));
    return WriteOutcome::Failed;
  };
  FileLayer& files = *files_;
  FileDescriptor dir(files.openFolder(folder_));
  if (!dir.valid()) return failed("opening the folder");
  OnDisk before = compareWithDisk(files, dir.get(), name, expected);
  if (before == OnDisk::Unknown) return failed("examining the file");
  if (before == OnDisk::Gone) return WriteOutcome::Removed;  // nothing left to keep
  if (before == OnDisk::Changed) {
    VTC_LOG_INFO("Not removing %@: it changed on disk since it was last read", path);
    return WriteOutcome::SkippedChangedOnDisk;
  }
  if (files.unlink(dir.get(), name) != 0 && errno != ENOENT) return failed("unlinking");
  if (!deferFlushes_ && files.syncFolder(dir.get()) != 0) return failed("flushing the folder");
  return WriteOutcome::Removed;
}

size_t VdirCollection::removeTemporaryLeftovers() const {
  FileDescriptor dir(files_->openFolder(folder_));
  std::vector<std::string> names;
  if (!dir.valid() || !files_->list(dir.get(), names)) {
    VTC_LOG_WARNING("Could not look for leftover temporary files in %@: %s", folder_,
                    strerror(errno));
    return 0;
  }
  size_t removed = 0;
  for (const std::string& name : names) {
    if (!isTemporaryName(name)) continue;
    if (files_->unlink(dir.get(), name) != 0 && errno != ENOENT) {
      VTC_LOG_WARNING("Could not remove the leftover %@: %s", paths::join(folder_, name),
                      strerror(errno));
      continue;
    }
    VTC_LOG_INFO("Removed the leftover %@ of a write cut short", paths::join(folder_, name));
    ++removed;
  }
  return removed;
}

bool VdirCollection::flush() const {
  FileDescriptor dir(files_->openFolder(folder_));
  if (!dir.valid() || files_->syncFileSystem(dir.get()) != 0) {
    VTC_LOG_ERROR("Could not flush the writes in %@: %s", folder_, strerror(errno));
    return false;
  }
  return true;
}

}  // namespace vtc::client
