// `conflicts`, `conflicts restore ID`, `conflicts drop ID`: the losing
// values kept when two computers changed the same field.
#include <ostream>

#include "client/cli/Commands.h"
#include "client/cli/StatusText.h"
#include "client/cli/TerminalText.h"
#include "client/items/ItemRecord.h"
#include "client/items/Meaning.h"
#include "client/merge/RecordMerge.h"
#include "client/merge/Restore.h"
#include "client/run/Collections.h"
#include "client/run/ConflictStore.h"
#include "client/run/DataclassSync.h"
#include "client/run/FolderWrite.h"
#include "client/run/SyncFailure.h"
#include "client/run/SyncOwner.h"
#include "client/stores/VdirCollection.h"
#include "common/Format.h"

namespace vtc::client {

namespace {

// A unit's lines on one line: folding undone, line ends dropped.
std::string shown(const Value& value) {
  if (value.isNone()) return "(removed)";
  if (value.isDictionary()) return "(the whole item as it was here)";
  std::string text(rawOf(value)), out;
  for (size_t i = 0; i < text.size(); ++i) {
    if (text[i] == '\r') continue;
    if (text[i] == '\n') {
      if (i + 1 < text.size() && (text[i + 1] == ' ' || text[i + 1] == '\t'))
        ++i;  // a folded line goes on
      else if (i + 1 < text.size())
        out += " | ";
      continue;
    }
    out += text[i];
  }
  return shownSafely(out);
}

// What the conflict is about: a property, an occurrence, or the item.
std::string subject(const KeptConflict& c) {
  if (c.field == merge::kRecordField) return "the item";
  if (nameOf(c.field) == merge::kComponentName) {
    const std::string_view scope = scopeOf(c.field);
    const size_t first = scope.find('/'), second = scope.find('/', first + 1);
    const std::string_view rid = scope.substr(first + 1, second - first - 1);
    return rid.empty() ? "the series" : "the occurrence of " + std::string(rid);
  }
  return std::string(nameOf(c.field));
}

KeptConflict findOrFail(const ConflictStore& store, const std::string& id) {
  auto conflict = store.find(id);
  if (!conflict)
    throw SyncFailure(FailureKind::Usage, "No conflict is kept as " + id +
                                              "; `nubilosyncclient conflicts` lists them.");
  return *conflict;
}

// The losing side written into the item's file (or the file made again,
// or removed, for a delete that lost), as if edited there: the next sync
// sends it as an ordinary edit.
void restore(const KeptConflict& c) {
  auto collection = configuredCollection(c.dataclass);
  if (!collection)
    throw SyncFailure(FailureKind::Usage, c.dataclass + " is no longer synced on this computer.");
  // A sync writes the folder too, and removes temporary files it finds there.
  auto owner = SyncOwner::acquire();
  VdirCollection folder(collection->folder, collection->kind);
  // The file that holds the record now: it may have been renamed since.
  std::string file = c.file;
  {
    auto engine = engine::SyncEngine::open();
    for (const auto& [name, stamp] : engine->itemStamps(folderClient(c.dataclass), c.dataclass))
      if (stamp.record == c.record) file = name;
  }
  std::optional<ItemState> state =
      isAcceptableFileName(file, collection->kind) ? folder.stat(file) : std::nullopt;
  if (!isAcceptableFileName(file, collection->kind)) file = fileNameFor(c.record, collection->kind);
  std::optional<std::string> bytes = state ? folder.read(file) : std::nullopt;
  std::optional<Dictionary> current;
  if (bytes) current = recordOfBytes(collection->kind, *bytes, file, &c.item);
  if (bytes && !current)
    throw SyncFailure(FailureKind::Other,
                      file + " is not a valid item now; fix it first, then restore.");
  std::optional<Dictionary> restored =
      merge::restoredRecord(collection->kind, current, c.field, c.lost, c.item);
  WriteOutcome outcome = WriteOutcome::Removed;
  if (!restored) {
    if (state) outcome = folder.remove(file, *state);
  } else {
    std::string problem;
    std::optional<std::string> out =
        renderRecord(*restored, current ? &*current : nullptr, &problem);
    if (!out)
      throw SyncFailure(FailureKind::Other, "The losing value cannot be written back: " + problem);
    outcome = folder.write(file, *out, state, nullptr);
    if (outcome == WriteOutcome::Written) outcome = WriteOutcome::Removed;
  }
  if (outcome != WriteOutcome::Removed)
    throw SyncFailure(FailureKind::Other,
                      file + " changed while it was being restored; try again.");
}

}  // namespace

int conflictsCommand(const std::string& action, const std::string& id, Output& output) {
  ConflictStore store;
  if (action == "restore" || action == "drop") {
    const KeptConflict c = findOrFail(store, id);
    if (action == "restore") restore(c);
    store.drop(id);
    if (output.verbosity > 0)
      output.out << (action == "restore" ? "Restored " : "Dropped ") << shownSafely(subject(c))
                 << " of " << shownSafely(c.file)
                 << (c.name.empty() || c.name == c.file ? "" : " (" + shownSafely(c.name) + ")")
                 << (action == "restore" ? "; the next sync sends it." : ".") << "\n";
    return 0;
  }
  const auto conflicts = store.list();
  if (conflicts.empty()) {
    if (output.verbosity > 0) output.out << "No conflicts are kept.\n";
    return 0;
  }
  for (const KeptConflict& c : conflicts) {
    output.out << c.id << "  " << c.dataclass << "  " << shownSafely(c.file) << "  "
               << shownSafely(subject(c))
               << (c.name.empty() || c.name == c.file ? "" : "  (" + shownSafely(c.name) + ")")
               << "\n";
    if (c.field == merge::kRecordField && c.lost.isNone())
      output.out << "    deleted here, and kept because " << shownSafely(c.keptComputer)
                 << " edited it; `nubilosyncclient conflicts restore " << c.id
                 << "` deletes it again\n";
    else
      output.out << "    kept: " << shown(c.kept) << "  (from " << shownSafely(c.keptComputer)
                 << ")\n"
                 << "    lost: " << shown(c.lost) << "  (from " << shownSafely(c.lostComputer)
                 << ", " << localTime(c.date) << ")\n";
  }
  return 0;
}

}  // namespace vtc::client
