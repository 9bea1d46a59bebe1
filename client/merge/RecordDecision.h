// What a sync does with one record, given what this computer last synced,
// what it has now and what the share has now: the record's new truth, the
// change to send, whether its file must be written, and what was lost.
// A pure function; the sync run gathers its inputs and carries out the
// result.
#pragma once

#include <optional>
#include <string>

#include "VantorSyncManager/SyncEngineChange.h"
#include "client/merge/RecordMerge.h"

namespace vtc::client::merge {

struct RecordSides {
  std::optional<Dictionary> base;    // the truth as last synced (none: not known)
  std::optional<Dictionary> ours;    // this computer's version now
  std::optional<Dictionary> theirs;  // the share's version now
  bool changedHere = false;          // ours differs from base
  bool changedThere = false;         // theirs differs from base
  // The record that the folder's file holds now (none: no file).
  std::optional<Dictionary> file;
};

struct RecordDecision {
  Merged merged;                         // the new truth, and what was lost
  std::optional<SyncEngineChange> send;  // what the share must take
  bool truthChanged = false;
  bool folderTakes = false;  // the file must be written, renamed or removed
};

RecordDecision decideRecord(ItemKind kind, const std::string& id, const RecordSides& sides);

// The change that turns the share's version into `to` (none when they are
// the same).
std::optional<SyncEngineChange> changeFor(const std::string& id,
                                          const std::optional<Dictionary>& theirs,
                                          const std::optional<Dictionary>& to);

}  // namespace vtc::client::merge
