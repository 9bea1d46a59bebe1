// A file layer that knows what a power cut would leave of one folder: its
// entries as of the folder's last flush (syncFolder or syncFileSystem), and
// each file's bytes as of that file's last flush (syncFile or
// syncFileSystem); an entry whose bytes never reached the disk comes back
// empty. It records the order of creates, writes, renames, removals and
// flushes in the folder, cuts the power before or after any of them
// (raising PowerCut, after which it does nothing more), and puts the folder back to
// what was durable, keeping the inodes of the files that are still there.
// Operations elsewhere pass through unrecorded. Installs itself for its
// lifetime; used from one thread.
#pragma once

#include <sys/types.h>

#include <cstddef>
#include <functional>
#include <map>
#include <optional>
#include <set>
#include <string>
#include <utility>
#include <vector>

#include "client/stores/FileLayer.h"

namespace vtc::test {

class PowerCutFiles : public client::FileLayer {
 public:
  struct Event {
    std::string operation;  // "create", "write", "sync file", "rename", "rename new",
                            // "unlink", "sync folder", "sync all"
    std::string name;       // the entry (the new name of a rename)
  };
  struct PowerCut {};  // raised where the power went

  // What the folder holds now counts as durable.
  explicit PowerCutFiles(std::string folder);
  ~PowerCutFiles() override;

  // Everything in the folder counts as durable now (files written by the
  // test, or a folder put back).
  void settle();
  const std::vector<Event>& events() const { return events_; }
  // Forgets the events so far, and any cut asked for.
  void clearEvents() {
    events_.clear();
    cutAt_ = cutBefore_ = kNever;
  }
  // Cuts the power as the nth event from now (0-based) is asked for, so
  // that it is not carried out, or right after it is.
  void cutBefore(size_t n) { cutBefore_ = events_.size() + n; }
  void cutAfter(size_t n) { cutAt_ = events_.size() + n; }
  // Told of each event before it is carried out.
  std::function<void(const Event&)> beforeEach;

  // What a power cut now would leave of an entry: the inode it names and
  // that file's bytes (none: never flushed, so empty after the cut).
  struct Durable {
    ino_t inode = 0;
    std::optional<std::string> bytes;
  };
  std::map<std::string, Durable> durable() const;
  // Whether the file was made through this layer (a write of the sync).
  bool created(ino_t inode) const { return created_.count(inode) > 0; }
  // Names removed through this layer.
  const std::set<std::string>& removed() const { return removed_; }
  // Puts the folder back to what was durable and powers on again.
  void restoreDurable();

  int createTemporary(int folder, const std::string& name, mode_t mode) override;
  bool write(int file, std::string_view bytes) override;
  int syncFile(int file) override;
  int rename(int folder, const std::string& from, const std::string& to) override;
  int renameNoReplace(int folder, const std::string& from, const std::string& to) override;
  int unlink(int folder, const std::string& name) override;
  int syncFolder(int folder) override;
  int syncFileSystem(int folder) override;

 private:
  // One file from its making to its removal (an inode number is used
  // again once its file is gone).
  struct File {
    ino_t inode = 0;
    std::string written;                 // through the layer
    std::optional<std::string> durable;  // as of its last flush
  };

  bool watched(int folder) const;
  // Records the event, asks beforeEach; false once the power is off.
  bool begin(const std::string& operation, const std::string& name);
  // After an event was carried out: cuts the power where asked.
  void end();
  // The file an inode of the folder holds now.
  size_t fileOf(ino_t inode);
  // The folder's entries now, and the files they name.
  std::map<std::string, size_t> entriesNow();

  std::string folder_;
  dev_t device_ = 0;
  ino_t inode_ = 0;
  std::vector<Event> events_;
  static constexpr size_t kNever = static_cast<size_t>(-1);
  size_t cutAt_ = kNever;
  size_t cutBefore_ = kNever;
  bool off_ = false;
  std::vector<File> files_;
  std::map<ino_t, size_t> live_;                        // inode -> file
  std::map<std::string, size_t> durableEntries_;        // entry -> file
  std::map<int, std::pair<size_t, std::string>> open_;  // created: file, name
  std::set<ino_t> created_;
  std::set<std::string> removed_;
};

}  // namespace vtc::test
