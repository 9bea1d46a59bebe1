// `conflicts`, `conflicts restore ID`, `conflicts drop ID`: the losing
// values kept when two computers changed the same field.
#include <algorithm>
#include <ostream>

#include "VantorSyncManager/NubiloException.h"
#include "VantorSyncManager/VTCPrefsCenter.h"

#include "client/cli/Commands.h"
#include "client/cli/StatusText.h"
#include "client/cli/TerminalText.h"
#include "client/items/ItemRecord.h"
#include "client/items/Meaning.h"
#include "client/merge/RecordMerge.h"
#include "client/merge/Restore.h"
#include "client/run/Account.h"
#include "client/run/AccountKey.h"
#include "client/run/Collections.h"
#include "client/run/ConflictStore.h"
#include "client/run/DataclassSync.h"
#include "client/run/FailureText.h"
#include "client/run/FolderWrite.h"
#include "client/run/SharedConflicts.h"
#include "client/run/SyncFailure.h"
#include "client/run/SyncOwner.h"
#include "client/stores/VdirCollection.h"
#include "common/Format.h"

namespace vtc::client {

namespace {

std::string shown(const Value& value) {
  return shownSafely(conflictValueLine(value));
}

std::string subject(const KeptConflict& c) {
  return conflictSubject(c.field);
}

// Both values side by side, each under the computer it came from.
void sideBySide(const std::string& keptHead, const std::string& kept, const std::string& lostHead,
                const std::string& lost, std::ostream& out) {
  const size_t width = std::min<size_t>(40, std::max({keptHead.size(), kept.size(), size_t{12}}));
  auto padded = [&](const std::string& text) {
    return text.size() >= width ? text : text + std::string(width - text.size(), ' ');
  };
  out << "          " << padded(keptHead) << " | " << lostHead << "\n"
      << "          " << padded(kept) << " | " << lost << "\n";
}

// "Ann Smith: TEL  (ann.vcf, com.korvo.Contacts)"
std::string heading(const std::string& name, const std::string& file, const std::string& what,
                    const std::string& dataclass) {
  const std::string shownName = shownSafely(name.empty() ? file : name);
  return shownName + ": " + shownSafely(what) + "  (" +
         (name.empty() || name == file ? "" : shownSafely(file) + ", ") + shownSafely(dataclass) +
         ")";
}

// What the other computers of the account keep, as their records on the
// share tell it; a share that cannot be asked is said in one line.
void listOthers(Output& output) {
  std::vector<SharedConflict> others;
  try {
    VTCPrefsCenter& prefs = VTCPrefsCenter::defaultCenter();
    if (!prefs.syncTurnedOn()) return;
    const auto [member, password] = storedCredentials();
    auto session = openSession(member, password, prefs.configuration());
    session->setAccountSeal(accountSeal(member));
    const std::string own = prefs.clientGuid().value_or("");
    for (const Value& client : session->getAllClientInfo()) {
      const Dictionary& c = client.dictionary();
      if (c.get("guid").string() == own) continue;
      std::string text = c.get(kSharedConflictsKey).string();
      if (const sealing::AccountSeal* seal = session->accountSeal()) {
        // A list that does not open with this account's key is left out.
        text = seal->openText(text, sealing::kSharedConflictsPurpose).value_or("");
      }
      for (SharedConflict& shared : readSharedConflicts(c.get("clientname").string(), text))
        others.push_back(std::move(shared));
    }
  } catch (const SyncFailure& e) {
    if (output.verbosity > 0)
      output.err << "nubilosyncclient: the other computers' conflicts are not shown: "
                 << shownSafely(e.what()) << "\n";
    return;
  } catch (const NubiloException& e) {
    if (output.verbosity > 0)
      output.err << "nubilosyncclient: the other computers' conflicts are not shown: "
                 << shownSafely(failureSentence("the account", e)) << "\n";
    return;
  }
  std::string computer;
  for (const SharedConflict& c : others) {
    if (c.computer != computer) {
      computer = c.computer;
      output.out << "\nKept on " << shownSafely(computer) << " (restore or drop them there):\n";
    }
    output.out << "  " << heading(c.name, c.file, c.field, c.dataclass) << "\n";
    sideBySide("kept (from " + shownSafely(c.keptComputer) + ")", shownSafely(c.kept),
               "lost (from " + shownSafely(c.lostComputer) + ", " + shownSafely(c.date) + ")",
               shownSafely(c.lost), output.out);
  }
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
  if (action == "drop" && id.empty()) {
    const auto all = store.list();
    for (const KeptConflict& c : all) store.drop(c.id);
    if (output.verbosity > 0)
      output.out << "Dropped " << all.size() << (all.size() == 1 ? " conflict" : " conflicts")
                 << "; the values that stand are unchanged.\n";
    return 0;
  }
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
  if (conflicts.empty() && output.verbosity > 0) output.out << "No conflicts are kept here.\n";
  for (const KeptConflict& c : conflicts) {
    output.out << c.id << "  " << heading(c.name, c.file, subject(c), c.dataclass) << "\n";
    if (c.field == merge::kRecordField && c.lost.isNone())
      output.out << "          deleted here, and kept because " << shownSafely(c.keptComputer)
                 << " edited it; `nubilosyncclient conflicts restore " << c.id
                 << "` deletes it again\n";
    else
      sideBySide("kept (from " + shownSafely(c.keptComputer) + ")", shown(c.kept),
                 "lost (from " + shownSafely(c.lostComputer) + ", " + localTime(c.date) + ")",
                 shown(c.lost), output.out);
  }
  listOthers(output);
  return 0;
}

}  // namespace vtc::client
