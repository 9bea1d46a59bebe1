#include "client/merge/RecordDecision.h"

namespace vtc::client::merge {

std::optional<SyncEngineChange> changeFor(const std::string& id,
                                          const std::optional<Dictionary>& theirs,
                                          const std::optional<Dictionary>& to) {
  if (sameRecord(theirs, to)) return std::nullopt;
  if (!to) return SyncEngineChange(SyncEngineChange::kDelete, id, Array{});
  if (!theirs) return SyncEngineChange(SyncEngineChange::kAdd, id, recordSets(*to));
  return SyncEngineChange(SyncEngineChange::kModify, id, recordChanges(*theirs, *to));
}

RecordDecision decideRecord(ItemKind kind, const std::string& id, const RecordSides& sides) {
  RecordDecision d;
  if (sides.changedHere && sides.changedThere)
    d.merged = mergeRecord(kind, sides.base, sides.ours, sides.theirs);
  else if (sides.changedHere)
    d.merged.record = sides.ours;
  else if (sides.changedThere)
    d.merged.record = sides.theirs;
  else
    d.merged.record = sides.base;
  const std::optional<Dictionary>& now = d.merged.record;
  d.send = changeFor(id, sides.theirs, now);
  d.truthChanged = now.has_value() != sides.base.has_value() || (now && !(*now == *sides.base));
  d.folderTakes = !sameRecord(now, sides.file);
  return d;
}

}  // namespace vtc::client::merge
