#include "support/PowerCutFiles.h"

#include <sys/stat.h>

#include <cerrno>
#include <filesystem>
#include <fstream>
#include <iterator>

namespace vtc::test {

namespace {

namespace fs = std::filesystem;

ino_t inodeOf(const std::string& path) {
  struct stat st {};
  return ::stat(path.c_str(), &st) == 0 ? st.st_ino : 0;
}

std::string bytesOf(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  return std::string(std::istreambuf_iterator<char>(in), {});
}

// Rewrites a file's bytes in place, so that it keeps its inode.
void rewrite(const std::string& path, const std::string& bytes) {
  if (fs::exists(path) && bytesOf(path) == bytes) return;
  std::ofstream(path, std::ios::binary | std::ios::trunc) << bytes;
}

}  // namespace

PowerCutFiles::PowerCutFiles(std::string folder) : folder_(std::move(folder)) {
  struct stat st {};
  if (::stat(folder_.c_str(), &st) == 0) {
    device_ = st.st_dev;
    inode_ = st.st_ino;
  }
  settle();
  client::installFileLayer(this);
}

PowerCutFiles::~PowerCutFiles() {
  client::installFileLayer(nullptr);
}

size_t PowerCutFiles::fileOf(ino_t inode) {
  auto it = live_.find(inode);
  if (it != live_.end()) return it->second;
  files_.push_back(File{inode, {}, {}});
  return live_[inode] = files_.size() - 1;
}

std::map<std::string, size_t> PowerCutFiles::entriesNow() {
  std::map<std::string, size_t> entries;
  for (const auto& entry : fs::directory_iterator(folder_))
    if (entry.is_regular_file())
      entries[entry.path().filename().string()] = fileOf(inodeOf(entry.path().string()));
  return entries;
}

void PowerCutFiles::settle() {
  durableEntries_ = entriesNow();
  for (const auto& [name, file] : durableEntries_)
    files_[file].durable = bytesOf(folder_ + "/" + name);
}

std::map<std::string, PowerCutFiles::Durable> PowerCutFiles::durable() const {
  std::map<std::string, Durable> out;
  for (const auto& [name, file] : durableEntries_)
    out[name] = Durable{files_[file].inode, files_[file].durable};
  return out;
}

bool PowerCutFiles::watched(int folder) const {
  struct stat st {};
  return ::fstat(folder, &st) == 0 && st.st_dev == device_ && st.st_ino == inode_;
}

bool PowerCutFiles::begin(const std::string& operation, const std::string& name) {
  if (off_) {
    errno = EIO;
    return false;
  }
  if (events_.size() == cutBefore_) {
    off_ = true;
    throw PowerCut{};
  }
  Event event{operation, name};
  if (beforeEach) beforeEach(event);
  events_.push_back(std::move(event));
  return true;
}

void PowerCutFiles::end() {
  if (events_.size() - 1 != cutAt_) return;
  off_ = true;
  throw PowerCut{};
}

int PowerCutFiles::createTemporary(int folder, const std::string& name, mode_t mode) {
  if (!watched(folder)) return FileLayer::createTemporary(folder, name, mode);
  if (!begin("create", name)) return -1;
  const int fd = FileLayer::createTemporary(folder, name, mode);
  struct stat st {};
  if (fd >= 0 && ::fstat(fd, &st) == 0) {
    // A new file, though its inode number may have served one removed.
    files_.push_back(File{st.st_ino, {}, {}});
    live_[st.st_ino] = files_.size() - 1;
    open_[fd] = {files_.size() - 1, name};
    created_.insert(st.st_ino);
  }
  end();
  return fd;
}

bool PowerCutFiles::write(int file, std::string_view bytes) {
  auto it = open_.find(file);
  if (it == open_.end()) return FileLayer::write(file, bytes);
  const auto& [made, name] = it->second;
  if (!begin("write", name)) return false;
  const bool done = FileLayer::write(file, bytes);
  if (done) files_[made].written.append(bytes);
  end();
  return done;
}

int PowerCutFiles::syncFile(int file) {
  auto it = open_.find(file);
  if (it == open_.end()) return FileLayer::syncFile(file);
  const auto& [made, name] = it->second;
  if (!begin("sync file", name)) return -1;
  const int r = FileLayer::syncFile(file);
  if (r == 0) files_[made].durable = files_[made].written;
  end();
  return r;
}

int PowerCutFiles::rename(int folder, const std::string& from, const std::string& to) {
  if (!watched(folder)) return FileLayer::rename(folder, from, to);
  if (!begin("rename", to)) return -1;
  const int r = FileLayer::rename(folder, from, to);
  end();
  return r;
}

int PowerCutFiles::renameNoReplace(int folder, const std::string& from, const std::string& to) {
  if (!watched(folder)) return FileLayer::renameNoReplace(folder, from, to);
  if (!begin("rename new", to)) return -1;
  const int r = FileLayer::renameNoReplace(folder, from, to);
  end();
  return r;
}

int PowerCutFiles::unlink(int folder, const std::string& name) {
  if (!watched(folder)) return FileLayer::unlink(folder, name);
  if (!begin("unlink", name)) return -1;
  const int r = FileLayer::unlink(folder, name);
  if (r == 0) removed_.insert(name);
  end();
  return r;
}

int PowerCutFiles::syncFolder(int folder) {
  if (!watched(folder)) return FileLayer::syncFolder(folder);
  if (!begin("sync folder", "")) return -1;
  const int r = FileLayer::syncFolder(folder);
  if (r == 0) durableEntries_ = entriesNow();
  end();
  return r;
}

int PowerCutFiles::syncFileSystem(int folder) {
  if (!watched(folder)) return FileLayer::syncFileSystem(folder);
  if (!begin("sync all", "")) return -1;
  const int r = FileLayer::syncFileSystem(folder);
  if (r == 0) settle();
  end();
  return r;
}

void PowerCutFiles::restoreDurable() {
  // Entries that are not as the disk has them step aside under their file,
  // then each durable entry takes its place again, with its inode where its
  // file is still there, and its durable bytes.
  std::map<size_t, std::string> aside;
  for (const auto& [name, file] : entriesNow()) {
    auto durable = durableEntries_.find(name);
    if (durable != durableEntries_.end() && durable->second == file) continue;
    const std::string held = folder_ + "/.held-" + std::to_string(file);
    fs::rename(folder_ + "/" + name, held);
    aside[file] = held;
  }
  for (const auto& [name, file] : durableEntries_) {
    const std::string path = folder_ + "/" + name;
    if (auto held = aside.find(file); held != aside.end()) {
      fs::rename(held->second, path);
      aside.erase(held);
    }
    rewrite(path, files_[file].durable.value_or(""));
  }
  for (const auto& [file, held] : aside) fs::remove(held);
  off_ = false;
  cutAt_ = cutBefore_ = kNever;
  open_.clear();
  live_.clear();
  settle();
}

}  // namespace vtc::test
