#include "client/stores/VdirCollection.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <memory>
#include <stdexcept>

#include "client/stores/ItemFiles.h"
#include "client/stores/ItemLayout.h"
#include "common/Logging.h"
#include "platform/fs/LocalPaths.h"

namespace vtc::client {

namespace {

struct DirectoryCloser {
  void operator()(DIR* d) const { ::closedir(d); }
};

std::runtime_error unreadableFolder(const std::string& folder, int error) {
  if (error == ENOENT) return std::runtime_error(format("The folder %@ does not exist.", folder));
  if (error == ENOTDIR) return std::runtime_error(format("%@ is not a folder.", folder));
  return std::runtime_error(format("The folder %@ cannot be read: %s.", folder, strerror(error)));
}

const char* formatName(ItemKind kind) {
  return kind == ItemKind::Contacts ? "vCard" : "iCalendar item";
}

}  // namespace

VdirCollection::VdirCollection(std::string folder, ItemKind kind)
    : folder_(std::move(folder)), kind_(kind) {}

bool VdirCollection::exists() const {
  struct stat st {};
  return ::stat(folder_.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
}

ScanResult VdirCollection::scan(const std::map<std::string, ItemState>& known) const {
  std::unique_ptr<DIR, DirectoryCloser> dir(::opendir(folder_.c_str()));
  if (!dir) throw unreadableFolder(folder_, errno);
  int dirFd = ::dirfd(dir.get());

  ScanResult result;
  // A file that cannot be taken as an item keeps the state it had, so that
  // it is neither deleted nor added again once it is fixed.
  auto skip = [&](const std::string& name) {
    result.invalid.push_back(name);
    if (auto it = known.find(name); it != known.end()) result.states.insert(*it);
  };
  for (;;) {
    errno = 0;
    const dirent* entry = ::readdir(dir.get());
    if (!entry) {
      // A listing cut short would make every file after the error look deleted.
      if (errno != 0) throw unreadableFolder(folder_, errno);
      break;
    }
    std::string name = entry->d_name;
    if (!isItemFileName(name, kind_)) continue;
    struct stat st {};
    if (::fstatat(dirFd, name.c_str(), &st, 0) != 0) {
      if (errno == ENOENT) continue;  // removed since the listing: gone
      VTC_LOG_WARNING("Skipping %@: %s", paths::join(folder_, name), strerror(errno));
      skip(name);
      continue;
    }
    if (!S_ISREG(st.st_mode)) continue;
    ItemState state = fileState(st);
    auto before = known.find(name);
    if (before != known.end() && before->second.sameFileAs(state)) {
      result.states.insert(*before);
      continue;
    }

    FileDescriptor file(::openat(dirFd, name.c_str(), O_RDONLY | O_CLOEXEC));
    std::optional<std::string> bytes;
    // The state of what is read: a change after fstat shows at the next scan.
    if (file.valid() && ::fstat(file.get(), &st) == 0) bytes = readWhole(file.get());
    if (!bytes) {
      if (errno == ENOENT) continue;
      VTC_LOG_WARNING("Skipping %@: %s", paths::join(folder_, name), strerror(errno));
      skip(name);
      continue;
    }
    ++result.filesRead;
    std::string problem;
    std::optional<ItemLayout> layout = readItemLayout(kind_, *bytes, &problem);
    if (!layout) {
      VTC_LOG_WARNING("Skipping %@, which is not a valid %s: %@", paths::join(folder_, name),
                      formatName(kind_), problem);
      skip(name);
      continue;
    }
    state = fileState(st);
    state.fields = std::move(layout->fields);
    if (before == known.end())
      result.added.emplace(name, state.fields);
    else if (!(before->second.fields == state.fields))
      result.changed.emplace(name, state.fields);
    result.states.emplace(std::move(name), std::move(state));
  }

  for (const auto& [name, state] : known)
    if (!result.states.contains(name)) result.deleted.push_back(name);
  std::sort(result.invalid.begin(), result.invalid.end());
  return result;
}

std::optional<std::string> VdirCollection::read(const std::string& name) const {
  if (!isItemFileName(name, kind_) || name.find('/') != std::string::npos) return std::nullopt;
  FileDescriptor file(::open(paths::join(folder_, name).c_str(), O_RDONLY | O_CLOEXEC));
  if (!file.valid()) return std::nullopt;
  return readWhole(file.get());
}

}  // namespace vtc::client
