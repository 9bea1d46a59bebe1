// A vdir collection: a folder whose items are one file each (".vcf" or
// ".ics"); every other file in the folder (such as "displayname" or
// "color") is left alone.
//
// A scan stats every item file and reads only those whose size, change time
// or inode differ from what was known, handing back their bytes cut into
// units, and the known items whose files are gone. A file rewritten in
// place at the same size within one tick of the file system's clock after
// it was read goes unseen until it changes again; programs that save by
// renaming a new file into place always give it a new inode.
//
// Writes are atomic (a temporary file in the folder, fsync, rename, fsync
// of the folder) and never overwrite a file that changed since it was last
// read or written: such a write is skipped and left for the next sync.
// A collection object is immutable: concurrent calls on it are safe.
#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "VantorSyncManager/Value.h"
#include "client/items/ItemText.h"
#include "client/stores/FileLayer.h"
#include "client/stores/VdirItem.h"

namespace vtc::client {

// What the sync knows of one item file: how it looked on disk when last
// read or written, and the record it holds.
struct ItemState {
  int64_t size = 0;
  int64_t modifiedNanoseconds = 0;  // st_mtim
  int64_t changedNanoseconds = 0;   // st_ctim
  uint64_t inode = 0;
  std::string record;  // the identity of the item it holds

  bool sameFileAs(const ItemState& other) const;  // size, times and inode
  friend bool operator==(const ItemState&, const ItemState&) = default;
};

// A file the scan read: its bytes, cut into units (views into the bytes,
// which stay where they are), and its state when read.
struct ItemFile {
  std::string bytes;
  ItemText text;
  ItemState state;
};

struct ScanResult {
  // Files new to the known set, or whose stamps changed, that are items.
  std::map<std::string, std::unique_ptr<ItemFile>> read;
  std::vector<std::string> deleted;  // known items whose files are gone
  // Files that are not items (skipped, Warning logged): name and why.
  std::vector<std::pair<std::string, std::string>> invalid;
  // The state of every item file now present: the known one where the file
  // is unchanged (or now unusable, so that it is neither deleted nor added
  // again once it is fixed), else the state it was read in.
  std::map<std::string, ItemState> states;
  size_t filesRead = 0;  // how many item files had to be read
};

enum class WriteOutcome { Written, Removed, SkippedChangedOnDisk, Failed };

class VdirCollection {
 public:
  // Its files are reached through the file layer current now.
  VdirCollection(std::string folder, ItemKind kind);

  const std::string& folder() const { return folder_; }
  ItemKind kind() const { return kind_; }
  // Whether the folder exists and is a folder.
  bool exists() const;

  // Compares the folder with the known states. Invalid files are reported,
  // never counted as deleted or changed. An unreadable folder raises
  // std::runtime_error (never "everything deleted"). Known states handed
  // over with std::move are not copied.
  ScanResult scan(std::map<std::string, ItemState> known) const;

  // Writes an item's bytes atomically, if the file is still as `expected`
  // says (none: the file must not exist). On Written, *state is the new
  // state (its record left empty). Failed: the bytes are no item, or a step
  // failed (logged as an Error, errno kept); the file may then already hold
  // the new bytes, which the next scan will see. A new file is private
  // (mode 0600); a replaced one keeps its mode. A name that is not an item
  // file name of this kind raises std::invalid_argument.
  WriteOutcome write(const std::string& name, const std::string& bytes,
                     const std::optional<ItemState>& expected, ItemState* state) const;
  // Removes an item's file, if it is still as `expected` says; a file that
  // is gone already counts as Removed.
  WriteOutcome remove(const std::string& name, const ItemState& expected) const;

  // Removes the temporary files that writes cut short left in the folder
  // (no write may be under way); how many went. A file that cannot be
  // removed is logged and left for the next time.
  size_t removeTemporaryLeftovers() const;

  // Many writes in a row: each write and removal skips its own flushes, and
  // flush() then makes all of them durable at once (one sync of the file
  // system instead of two per file). Until flush() returns true, a power
  // loss can undo or empty what was written.
  void deferFlushes(bool defer) { deferFlushes_ = defer; }
  bool flush() const;
  // The bytes of an item file; none when it cannot be read.
  std::optional<std::string> read(const std::string& name) const;
  // The state of an item file as it is now (no fields); none when it is gone.
  std::optional<ItemState> stat(const std::string& name) const;

 private:
  std::string folder_;
  ItemKind kind_;
  FileLayer* files_;
  bool deferFlushes_ = false;
};

}  // namespace vtc::client
