// A vdir collection: a folder whose items are one file each (".vcf" or
// ".ics"), named by the item's identity; every other file in the folder
// (such as "displayname" or "color") is the user's and is left alone.
//
// A scan stats every item file and reads only those whose size, change time
// or inode differ from what was known; it reports the items added, changed
// (their fields differ from the known ones) and deleted. A file rewritten
// in place at the same size within one tick of the file system's clock
// after it was read goes unseen until it changes again; programs that save
// by renaming a new file into place always give it a new inode.
//
// Writes are atomic (a temporary file in the folder, fsync, rename, fsync
// of the folder) and never overwrite a file that changed since it was last
// read or written: such a write is skipped and left for the next sync.
// A collection object is immutable: concurrent calls on it are safe.
#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "VantorSyncManager/Value.h"
#include "client/stores/VdirItem.h"

namespace vtc::client {

// What the sync knows of one item file: how it looked on disk when last
// read or written, and its fields then.
struct ItemState {
  int64_t size = 0;
  int64_t modifiedNanoseconds = 0;  // st_mtim
  int64_t changedNanoseconds = 0;   // st_ctim
  uint64_t inode = 0;
  Dictionary fields;

  // As a property-list value, for storage, and back (none for a bad value).
  Value toValue() const;
  static std::optional<ItemState> fromValue(const Value& value);
  bool sameFileAs(const ItemState& other) const;  // size, times and inode
  friend bool operator==(const ItemState&, const ItemState&) = default;
};

struct ScanResult {
  // File name -> fields, for items new to the known set and items whose
  // fields changed.
  std::map<std::string, Dictionary> added;
  std::map<std::string, Dictionary> changed;
  std::vector<std::string> deleted;  // known items whose files are gone
  std::vector<std::string> invalid;  // files that are not valid items (skipped, Warning logged)
  // The state of every valid item file now present (known ones included):
  // what the sync stores once the scan's changes are safely in the engine.
  // A known file that is now invalid or unreadable keeps its known state.
  std::map<std::string, ItemState> states;
  size_t filesRead = 0;  // how many item files had to be read
};

enum class WriteOutcome { Written, Removed, SkippedChangedOnDisk, Failed };

class VdirCollection {
 public:
  VdirCollection(std::string folder, ItemKind kind);

  const std::string& folder() const { return folder_; }
  ItemKind kind() const { return kind_; }
  // Whether the folder exists and is a folder.
  bool exists() const;

  // Compares the folder with the known states. Invalid files are reported,
  // never counted as deleted or changed. An unreadable folder raises
  // std::runtime_error (never "everything deleted"). Known states handed
  // over with std::move are not copied: those that still hold move into
  // the result.
  ScanResult scan(std::map<std::string, ItemState> known) const;

  // Writes an item's bytes atomically, if the file is still as `expected`
  // says (none: the file must not exist). On Written, *state is the new
  // state (fields from the bytes written). Failed: the bytes are not a valid
  // item, or a step failed (logged as an Error); the file may then already
  // hold the new bytes, which the next scan will see. A new file is private
  // (mode 0600); a replaced one keeps its mode. A name that is not an item
  // file name of this kind raises std::invalid_argument.
  WriteOutcome write(const std::string& name, const std::string& bytes,
                     const std::optional<ItemState>& expected, ItemState* state) const;
  // Removes an item's file, if it is still as `expected` says; a file that
  // is gone already counts as Removed.
  WriteOutcome remove(const std::string& name, const ItemState& expected) const;

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
  bool deferFlushes_ = false;
};

}  // namespace vtc::client
