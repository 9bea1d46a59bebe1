// `conflicts`, `conflicts restore ID`, `conflicts drop ID`: the losing
// values kept when two computers changed the same field.
#include <ostream>

#include "client/cli/Commands.h"
#include "client/cli/StatusText.h"
#include "client/cli/TerminalText.h"
#include "client/run/Collections.h"
#include "client/run/ConflictStore.h"
#include "client/run/SyncFailure.h"
#include "client/stores/VdirCollection.h"
#include "common/Format.h"

namespace vtc::client {

namespace {

// A field's lines on one line: folding undone, line ends dropped.
std::string shown(const Value& value) {
  if (value.isNone()) return "(cleared)";
  std::string text = textOf(value), out;
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

KeptConflict findOrFail(const ConflictStore& store, const std::string& id) {
  auto conflict = store.find(id);
  if (!conflict)
    throw SyncFailure(FailureKind::Usage, "No conflict is kept as " + id +
                                              "; `nubilosyncclient conflicts` lists them.");
  return *conflict;
}

// The losing value written into the item's file, as if edited there: the
// next sync sends it as an ordinary edit.
void restore(const KeptConflict& c) {
  auto collection = configuredCollection(c.dataclass);
  if (!collection)
    throw SyncFailure(FailureKind::Usage, c.dataclass + " is no longer synced on this computer.");
  VdirCollection folder(collection->folder, collection->kind);
  auto state = folder.stat(c.record);
  auto current = folder.read(c.record);
  if (!state || !current)
    throw SyncFailure(FailureKind::Other, c.record + " is no longer in " + collection->folder +
                                              "; the losing value has nothing to go back into.");
  if (c.field == "(record)") {  // the delete lost: restoring it deletes the item again
    if (folder.remove(c.record, *state) != WriteOutcome::Removed)
      throw SyncFailure(FailureKind::Other,
                        c.record + " changed while it was being restored; try again.");
    return;
  }
  Dictionary change{{"action", c.lost.isNone() ? "clear" : "set"}, {"name", c.field}};
  if (!c.lost.isNone()) change.set("value", c.lost);
  const std::string bytes = applyFieldChanges(collection->kind, current, Array{Value(change)});
  if (folder.write(c.record, bytes, state, nullptr) != WriteOutcome::Written)
    throw SyncFailure(FailureKind::Other,
                      c.record + " changed while it was being restored; try again.");
}

}  // namespace

int conflictsCommand(const std::string& action, const std::string& id, Output& output) {
  ConflictStore store;
  if (action == "restore" || action == "drop") {
    const KeptConflict c = findOrFail(store, id);
    if (action == "restore") restore(c);
    store.drop(id);
    if (output.verbosity > 0)
      output.out << (action == "restore" ? "Restored " : "Dropped ") << shownSafely(c.field)
                 << " of " << shownSafely(c.record)
                 << (action == "restore" ? "; the next sync sends it." : ".") << "\n";
    return 0;
  }
  const auto conflicts = store.list();
  if (conflicts.empty()) {
    if (output.verbosity > 0) output.out << "No conflicts are kept.\n";
    return 0;
  }
  for (const KeptConflict& c : conflicts)
    output.out << c.id << "  " << c.dataclass << "  " << shownSafely(c.record) << "  "
               << shownSafely(c.field) << "\n"
               << "    kept: " << shown(c.kept) << "  (from " << shownSafely(c.keptComputer)
               << ")\n"
               << "    lost: " << shown(c.lost) << "  (from " << shownSafely(c.lostComputer) << ", "
               << localTime(c.date) << ")\n";
  return 0;
}

}  // namespace vtc::client
