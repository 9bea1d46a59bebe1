// How two computers' edits of one contact or event combine: pure functions
// of records (see client/items/ItemRecord.h), with no files, engine or
// network. The sync run hands them the record as this computer last
// synced it (base), as this computer has it now (ours) and as the share
// has it now (theirs), and writes what they give back.
//
// The rules:
// - A field changed on one side only takes that side's value; values are
//   compared by meaning, so a re-folded line is no change.
// - A field changed on both sides to different values keeps theirs, the
//   value that reached the share first, and ours is kept as lost; a stamp
//   of when the item changed (REV, DTSTAMP, LAST-MODIFIED) keeps the later
//   one, and is no conflict.
// - Each instance of a repeated property is a field of its own, so edits
//   of two phone numbers, or two alarms added on two computers, both stand.
// - The times of an event or to-do (DTSTART, DTEND, DUE, DURATION, RRULE)
//   change as one unit: if both sides changed any of them, theirs stand
//   whole.
// - A series whose time or rule changed on one side against an occurrence
//   changed on the other: the share's side stands, the other is lost.
// - An edit beats a delete, of a record or of one occurrence: the record
//   comes back whole.
// - Without a base (a computer joining with items the share already has)
//   every field is taken from either side, theirs where both have one.
// - The result must be an item at least as good as its inputs; if not,
//   theirs stands whole and ours is lost whole.
#pragma once

#include <optional>
#include <string>
#include <vector>

#include "VantorSyncManager/Value.h"
#include "client/stores/VdirItem.h"

namespace vtc::client::merge {

// The record-level pseudo-field of a lost whole version or delete, and
// the name that marks a whole component ("<scope>/(component)").
inline constexpr char kRecordField[] = "(record)";
inline constexpr char kComponentName[] = "(component)";

// What a merge did not keep of this computer's version.
struct LostValue {
  std::string key;  // a field's key, "<scope>/(component)", or "(record)"
  Value kept;       // what stands instead (none: nothing does)
  Value lost;       // this computer's value (none: it had removed it)
};

struct Merged {
  std::optional<Dictionary> record;  // none: the record is deleted
  std::vector<LostValue> lost;
  // This computer deleted the record, and an edit made elsewhere brought
  // it back.
  bool deleteUndone = false;
  // The share deleted the record, and an edit made here brought it back.
  bool restoredHere = false;
};

// base: the record when this computer last synced (none: no common base;
// ours and theirs are then joined). ours/theirs none: deleted there.
Merged mergeRecord(ItemKind kind, const std::optional<Dictionary>& base,
                   const std::optional<Dictionary>& ours, const std::optional<Dictionary>& theirs);

// This computer's version of a record: the truth with the edits made in
// its file since the file was last read or written (fileBefore ->
// fileNow; none: no file) laid on top. An edit of a field that the truth
// changed meanwhile (the file had not taken that change in yet) loses to
// the truth; a delete of a file that had not taken in a change is undone.
Merged localVersion(ItemKind kind, const std::optional<Dictionary>& truth,
                    const std::optional<Dictionary>& fileBefore,
                    const std::optional<Dictionary>& fileNow);

// Whether two versions of a record hold the same units with the same
// meaning, in the same order, under the same file name.
bool sameRecord(const std::optional<Dictionary>& a, const std::optional<Dictionary>& b);

// The property changes ("set"/"clear") that turn `from` into `to`, by
// bytes: what a changelog carries.
Array recordChanges(const Dictionary& from, const Dictionary& to);
// Applies property changes to a record.
void applyChanges(Dictionary& record, const Array& changes);
// The sets that make a record from nothing.
Array recordSets(const Dictionary& record);

}  // namespace vtc::client::merge
