// What the changes of the share's changelogs, read in order, make of each
// record: every computer folds them the same way, so every computer ends
// with the same records. An add replaces a record whole; a modify changes
// fields; a delete removes the record but keeps it aside, so that a modify
// made elsewhere before the delete was seen brings it back whole (an edit
// beats a delete). A modify of a record never seen is kept as the fields
// it names, marked partial.
#pragma once

#include <optional>
#include <string>

#include "VantorSyncManager/SyncEngineChange.h"
#include "VantorSyncManager/Value.h"

namespace vtc::client::merge {

struct FoldState {
  std::optional<Dictionary> record;  // none: absent or deleted
  std::optional<Dictionary> buried;  // the record as it was when deleted
  std::string deletedBy;             // the computer that deleted it, when buried
  bool deletedHere = false;          // and whether that was this computer
  bool partial = false;              // known only from modifies
  bool restored = false;             // a modify or add brought it back after a delete
  std::string restoredDeletedBy;     // who had deleted it then
  bool restoredDeleteWasHere = false;
  std::string origin;    // the computer that changed it last
  bool changed = false;  // any change was folded in
};

// Folds one change into the state; `origin` names the computer whose
// changelog holds it, `here` whether that computer is this one.
void foldChange(FoldState& state, const SyncEngineChange& change, const std::string& origin,
                bool here);

}  // namespace vtc::client::merge
