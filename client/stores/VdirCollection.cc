#include "client/stores/VdirCollection.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <memory>
#include <stdexcept>

#include "client/stores/ItemFiles.h"
#include "common/Logging.h"
#include "platform/fs/LocalPaths.h"

namespace vtc::client {

namespace {

std::runtime_error unreadableFolder(const std::string& folder, int error) {
  if (error == ENOENT) return std::runtime_error(format("The folder %@ does not exist.", folder));
  if (error == ENOTDIR) return std::runtime_error(format("%@ is not a folder.", folder));
  return std::runtime_error(format("The folder %@ cannot be read: %s.", folder, strerror(error)));
}

// The names of the folder's item files, sorted. A listing cut short by an
// error raises: it would make every file after the error look deleted.
std::vector<std::string> itemFileNames(FileLayer& files, int dir, const std::string& folder,
                                       ItemKind kind) {
  std::vector<std::string> names;
  if (!files.list(dir, names)) throw unreadableFolder(folder, errno);
  std::erase_if(names, [&](const std::string& name) { return !isItemFileName(name, kind); });
  std::sort(names.begin(), names.end());
  return names;
}

// One file of a scan, in name order: its state goes to result.states and,
// when it was read, the file to result.read. `known` is its state from
// before, if any; keepsKnownState() is true when that state is to be kept
// as it is (the file is unchanged, or unusable and so skipped), which the
// caller moves into result.states.
class FileScan {
 public:
  FileScan(const std::string& folder, ItemKind kind, FileLayer& files, int dirFd,
           ScanResult& result)
      : folder_(folder), kind_(kind), files_(files), dirFd_(dirFd), result_(result) {}

  bool keepsKnownState(const std::string& name, const ItemState* known) {
    struct stat st {};
    if (files_.stat(dirFd_, name, &st) != 0) {
      if (errno == ENOENT) return false;  // removed since the listing, so gone
      return skip(name, known, strerror(errno));
    }
    if (!S_ISREG(st.st_mode)) return false;
    if (known && known->sameFileAs(fileState(st))) return true;

    auto item = std::make_unique<ItemFile>();
    // The state of what is read: a change after it shows at the next scan.
    std::optional<std::string> bytes = files_.read(dirFd_, name, &st);
    if (!bytes) return errno != ENOENT && skip(name, known, strerror(errno));
    item->bytes = std::move(*bytes);
    ++result_.filesRead;
    std::string problem;
    std::optional<ItemText> text = readItemText(kind_, item->bytes, &problem);
    if (!text) return skip(name, known, problem);
    item->text = std::move(*text);
    item->state = fileState(st);
    result_.states.emplace_hint(result_.states.end(), name, item->state);
    result_.read.emplace_hint(result_.read.end(), name, std::move(item));
    return false;
  }

 private:
  const std::string& folder_;
  ItemKind kind_;
  FileLayer& files_;
  int dirFd_;
  ScanResult& result_;

  // A file that cannot be taken as an item keeps the state it had, so that
  // it is neither deleted nor added again once it is fixed.
  bool skip(const std::string& name, const ItemState* known, const std::string& why) {
    VTC_LOG_WARNING("Skipping %@: %@", paths::join(folder_, name), why);
    result_.invalid.emplace_back(name, why);
    return known != nullptr;
  }
};

}  // namespace

VdirCollection::VdirCollection(std::string folder, ItemKind kind)
    : folder_(std::move(folder)), kind_(kind), files_(&currentFileLayer()) {}

bool VdirCollection::exists() const {
  struct stat st {};
  return ::stat(folder_.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
}

ScanResult VdirCollection::scan(std::map<std::string, ItemState> known) const {
  FileDescriptor dir(files_->openFolder(folder_));
  if (!dir.valid()) throw unreadableFolder(folder_, errno);
  ScanResult result;
  FileScan files(folder_, kind_, *files_, dir.get(), result);
  // Names and known states both in order: one walk matches them. A state
  // that still holds moves over whole.
  auto before = known.begin();
  for (const std::string& name : itemFileNames(*files_, dir.get(), folder_, kind_)) {
    while (before != known.end() && before->first < name) ++before;
    bool isKnown = before != known.end() && before->first == name;
    if (files.keepsKnownState(name, isKnown ? &before->second : nullptr))
      result.states.insert(result.states.end(), known.extract(before++));
  }
  auto now = result.states.begin();
  for (const auto& [name, state] : known) {
    while (now != result.states.end() && now->first < name) ++now;
    if (now == result.states.end() || now->first != name) result.deleted.push_back(name);
  }
  return result;
}

std::optional<std::string> VdirCollection::read(const std::string& name) const {
  if (!isItemFileName(name, kind_) || name.find('/') != std::string::npos) return std::nullopt;
  struct stat st {};
  return files_->read(AT_FDCWD, paths::join(folder_, name), &st);
}

bool ItemState::sameFileAs(const ItemState& other) const {
  return size == other.size && modifiedNanoseconds == other.modifiedNanoseconds &&
         changedNanoseconds == other.changedNanoseconds && inode == other.inode;
}

std::optional<ItemState> VdirCollection::stat(const std::string& name) const {
  struct stat st {};
  if (files_->stat(AT_FDCWD, paths::join(folder_, name), &st) != 0) return std::nullopt;
  return fileState(st);
}

}  // namespace vtc::client
