#include "client/run/DataclassSync.h"

#include <chrono>
#include <functional>
#include <set>

#include "VantorSyncManager/NubiloException.h"
#include "VantorSyncManager/PublicNames.h"
#include "VantorSyncManager/VTCPrefsCenter.h"
#include "client/items/ItemRecord.h"
#include "client/run/FailureText.h"
#include "client/run/ForeignLocks.h"
#include "client/run/Housekeeping.h"
#include "client/run/SyncFailure.h"
#include "common/Clock.h"
#include "common/Logging.h"
#include "platform/dav/TesselSession.h"

namespace vtc::client {

namespace {

// The delete guard looks at proportions only from this many deletes on.
constexpr size_t kDeletesThatAlwaysPass = 2;

// A delete the user confirmed with --max-delete carries this in its change
// list, so that the other computers apply it without asking again.
constexpr char kConfirmedDelete[] = "(confirmed)";

std::string percentText(size_t part, size_t whole) {
  return std::to_string(whole ? part * 100 / whole : 0) + "%";
}

bool isConfirmedDelete(const SyncEngineChange& change) {
  if (change.type() != SyncEngineChange::kDelete) return false;
  for (const Value& pc : change.changes())
    if (pc.isDictionary() && pc.dictionary().get("name") == Value(kConfirmedDelete)) return true;
  return false;
}

}  // namespace

std::string folderClient(const std::string& dataclass) {
  return "vdir:" + dataclass;
}

// The folder's side: the records its files changed, and this computer's
// version of each (the truth with the folder's edits on top).
struct DataclassSync::Local {
  FolderRead folder;
  std::map<std::string, Dictionary> truth;                   // of the records touched
  std::map<std::string, std::optional<Dictionary>> fileNow;  // what each touched file holds
  std::map<std::string, merge::Merged> versions;             // this computer's versions
  std::set<std::string> changed;                             // differ from the truth
  size_t localDeletes = 0;
  int64_t truthCount = 0;
};

// The share's side: what its changelogs make of each record they touch
// (fast), or of every record (slow), and the truth they are measured against.
struct DataclassSync::Incoming {
  DataclassRecord record;
  NetworkState state;
  bool slow = false;
  bool fetched = false;
  bool stateChanged = false;  // the state moved on without a fetch
  std::map<std::string, merge::FoldState> folds;
  std::map<std::string, Dictionary> base;
  std::set<std::string> confirmedDeletes;
  // Changes that could not be read: their records are set aside.
  std::vector<std::pair<std::string, std::optional<engine::SetAside>>> refused;
  std::set<std::string> refusedIds;
};

struct DataclassSync::Plan {
  std::vector<SyncEngineChange> send;
  std::vector<engine::SyncOutcome::Entry> truth;
  std::vector<std::string> takes;
  std::vector<KeptConflict> conflicts;
  std::map<std::string, std::string> origins;
  size_t incomingDeletes = 0;
};

DataclassSync::DataclassSync(NubiloRemoteSession& session, engine::SyncEngine& engine,
                             const Collection& collection, const SyncOptions& options,
                             ConflictStore& conflicts, HeldLocks& locks)
    : session_(session),
      engine_(engine),
      collection_(collection),
      folder_(collection.folder, collection.kind),
      options_(options),
      conflicts_(conflicts),
      locks_(locks),
      folderClient_(folderClient(collection.dataclass)) {
  outcome_.dataclass = collection.dataclass;
}

void DataclassSync::report(const char* what, size_t done, size_t total, int64_t bytes) {
  if (options_.progress) options_.progress->step(collection_.dataclass, what, done, total, bytes);
}

DataclassSync::Local DataclassSync::readLocal() {
  const std::string& dataclass = collection_.dataclass;
  Local local;
  report("reading the folder", 0, 0);
  local.folder = readFolder(folder_, engine_, folderClient_, dataclass);
  outcome_.invalidFiles = local.folder.invalid;
  std::vector<std::string> ids;
  for (const auto& [id, record] : local.folder.records) ids.push_back(id);
  local.truth = engine_.recordsWithIdentifiers(dataclass, ids);
  for (const auto& [id, record] : local.folder.records) {
    auto t = local.truth.find(id);
    std::optional<Dictionary> truth;
    if (t != local.truth.end()) truth = t->second;
    std::optional<Dictionary> now;
    if (record.now) {
      // Instances keep the keys the file, or else the truth, gave them.
      const Dictionary* previous = record.before ? &*record.before : truth ? &*truth : nullptr;
      now = toRecord(record.now->text, record.file, previous);
      // The record holds what the file said: its bytes are not needed again,
      // and the folder is held once, not twice.
      if (auto f = local.folder.scan.read.find(record.file);
          f != local.folder.scan.read.end() && f->second.get() == record.now) {
        f->second->text = ItemText();
        std::string().swap(f->second->bytes);
      }
    }
    merge::Merged version = merge::localVersion(collection_.kind, truth, record.before, now);
    if (!merge::sameRecord(version.record, truth)) {
      local.changed.insert(id);
      if (truth && !version.record) ++local.localDeletes;
    }
    local.fileNow.emplace(id, std::move(now));
    local.versions.emplace(id, std::move(version));
  }
  local.truthCount = engine_.recordCount(dataclass);
  return local;
}

DataclassOutcome DataclassSync::run(const std::optional<DataclassRecord>& listed) {
  const std::string& dataclass = collection_.dataclass;
  if (!folder_.exists())
    throw SyncFailure(FailureKind::Other,
                      "The folder " + collection_.folder + " of " + dataclass +
                          " is missing; create it, or stop syncing it with `nubilosyncclient "
                          "remove " +
                          dataclass + "`.");
  if (!options_.dryRun) removeFolderLeftovers(folder_);

  Local local = readLocal();
  // The guard for what goes out, before anything is written anywhere.
  const bool emptied = local.folder.scan.states.empty() && local.folder.invalid.empty() &&
                       local.folder.knownFiles > 0;
  const bool allowed = options_.maxDeletePercent >= 100;
  if (emptied && !allowed)
    throw SyncFailure(FailureKind::DeleteRefused,
                      "The folder " + collection_.folder + " of " + dataclass +
                          " is empty but held " + std::to_string(local.folder.knownFiles) +
                          " items; if they are meant to go everywhere, run `nubilosyncclient "
                          "sync " +
                          dataclass + " --max-delete 100`.");
  const size_t known = local.folder.knownFiles;
  if (!allowed && local.localDeletes > kDeletesThatAlwaysPass &&
      local.localDeletes * 100 > known * static_cast<size_t>(options_.maxDeletePercent))
    throw SyncFailure(FailureKind::DeleteRefused,
                      "Syncing " + dataclass + " would delete " +
                          std::to_string(local.localDeletes) + " of its " + std::to_string(known) +
                          " items on the other computers (" +
                          percentText(local.localDeletes, known) + ", more than " +
                          std::to_string(options_.maxDeletePercent) +
                          "%); if that is meant, run `nubilosyncclient sync " + dataclass +
                          " --max-delete 100`.");

  const NetworkState network =
      NetworkState::fromValue(engine_.clientState(kNetworkClient, dataclass));
  const bool unsent = !local.changed.empty();
  const bool serverMoved =
      listed && (listed->maxversion != network.index || listed->minversion != network.minversion);
  const bool serverLacksData = (!listed || !listed->maxversion) && (unsent || local.truthCount > 0);

  if (!unsent && !serverMoved && !serverLacksData && !options_.repair) {
    if (!options_.dryRun) {
      Plan plan;
      Incoming none;
      none.state = network;
      for (auto& [id, version] : local.versions) {
        const Dictionary item = version.record.value_or(Dictionary{});
        for (const merge::LostValue& lost : version.lost)
          plan.conflicts.push_back({"", dataclass, id, recordFile(item), displayName(item),
                                    lost.key, lost.kept, lost.lost, item, options_.computerName,
                                    options_.computerName, currentClock().now()});
      }
      keepConflicts(plan);
      // An idle sync writes nothing: the engine hears only of files read again.
      if (!local.folder.scan.read.empty() || !local.folder.scan.deleted.empty())
        store(local, plan, none);
      writeFolder(nullptr, &local.folder.scan.states);
    }
    return outcome_;
  }

  outcome_.usedServer = true;
  if (!options_.dryRun) lock(listed.has_value());
  std::map<std::string, std::string> origins;  // who last changed each record, for notes
  try {
    // Read again under the lock: the listing may be older than the lock.
    DataclassRecord record =
        options_.dryRun ? listed.value_or(DataclassRecord{})
                        : DataclassRecord::fromRecord(session_.getDataclassInfo(dataclass));
    bool needsTruth = false;
    if (!options_.dryRun) {
      const Value status = session_.getClientInfo().get(dataclass + ".status");
      needsTruth = status.isString() && status.string() == "needstruth";
    }
    if (options_.repair) {
      if (VTCPrefsCenter::defaultCenter().failedSyncCountForDataclass(dataclass) > 0)
        throw SyncFailure(FailureKind::Other,
                          "The last sync of " + dataclass +
                              " on this computer did not succeed, so its copy cannot repair the "
                              "share's; repair on a computer whose last sync of it succeeded.");
      if (record.maxversion && network.index != record.maxversion)
        throw SyncFailure(FailureKind::Other,
                          "This computer has not taken in every change of " + dataclass +
                              " yet, so its copy cannot repair the share's; repair on a "
                              "computer whose last sync of it succeeded.");
    }
    // A compaction by another computer whose truth this computer holds
    // already: the new history starts from what it has, so it goes on from
    // there instead of reading the whole truth again.
    NetworkState state = network;
    bool resumed = false;
    if (!options_.repair && record.truthIndex && record.minversion &&
        *record.minversion == *record.truthIndex + 1 && network.index == record.truthIndex &&
        network.minversion != record.minversion && record.truthDigest == truthDigestText()) {
      VTC_LOG_INFO("%@ was compacted at changelog %d from a truth this computer holds", dataclass,
                   *record.minversion);
      state = NetworkState{record.minversion, record.minversion};
      resumed = true;
    }
    const bool slow = !options_.repair && record.maxversion &&
                      (!state.index || record.minversion != state.minversion ||
                       *record.maxversion < *state.index || (needsTruth && !resumed));
    Incoming incoming = fetch(slow, record, state, local);
    incoming.stateChanged = resumed;
    // The fetch may have set a record right that named a changelog the
    // share lacks: the commit goes after what the share really holds, or it
    // would leave a hole that every computer then takes for damage.
    record = incoming.record;
    Plan plan = decide(local, incoming, record);
    origins = plan.origins;
    guardDeletes(local, plan);
    outcome_.sentChanges = plan.send.size();
    outcome_.filesWritten = plan.takes.size();
    if (!options_.dryRun) {
      // What runs cut short left on the share is looked for by syncs that
      // commit only: such a run sends its changes again, and leftovers can
      // wait for a commit more cheaply than every fetch can list them.
      if (!plan.send.empty()) removeShareLeftovers(session_, dataclass, record);
      // A long history is written again before this computer's changes go
      // out, as the truth the share holds now: computers that took it in
      // go on from it.
      if (!plan.send.empty() && compactionDue(record)) compact(record, incoming);
      commit(plan, record);
      incoming.record = record;
      keepConflicts(plan);
      store(local, plan, incoming);
      if (options_.repair) repair(record);
      if (needsTruth) try {
          session_.setStatus("normal", session_.configuration().get("guid").string(), dataclass);
        } catch (const NubiloException& e) {
          // Committed and stored: the next sync notes it again.
          VTC_LOG_WARNING("Could not note %@ as taken in: %@", dataclass, e.reason());
        }
    }
  } catch (...) {
    if (locked_) {
      try {
        unlock();
      } catch (const std::exception& e) {
        // The first failure is the one to report; this lock expires on its own.
        VTC_LOG_WARNING("Could not unlock %@ after a failure: %@", dataclass, e.what());
      }
    }
    throw;
  }
  if (locked_) unlock();
  if (!options_.dryRun) {
    outcome_.filesWritten = 0;
    writeFolder(&origins, &local.folder.scan.states);
  }
  return outcome_;
}

// Runs a lock operation; when the share refuses it because of a lock that
// names this computer, that lock is a leftover (a run of this computer that
// ended without giving it back, or a lock the server brought back): no other
// run of this computer can hold it while this one owns the sync, so it is
// given back and the lock asked for once more.
void DataclassSync::lockReleasingOwnLeftovers(const std::function<void()>& lockOperation) {
  try {
    lockOperation();
    return;
  } catch (const NubiloException& e) {
    if (e.name() != NubiloLockFailureException) throw;
    const std::string own = session_.configuration().get("guid").string();
    bool released = false;
    const std::string path = e.userInfo().get(kNBURI).string();
    for (const Value& held : e.userInfo().get("DAV:lockdiscovery").array()) {
      const Dictionary& lock = held.dictionary();
      const bool mine = !own.empty() && lock.get("clientid").string() == own;
      // Another computer's lock that its run stopped renewing is taken over.
      if (!mine && !abandonedLock(lock, session_.lockDuration())) continue;
      VTC_LOG_WARNING("Giving back a lock of %@ left on %@",
                      mine ? std::string("this computer") : lock.get("clientname").string(), path);
      session_.tesselSession().unlockResourceWithToken(path, lock.get("token").string());
      if (!mine) outcome_.notes.push_back(takeoverSentence(collection_.dataclass, lock));
      released = true;
    }
    if (!released) throw;
  }
  lockOperation();
}

void DataclassSync::lock(bool listed) {
  const std::string& dataclass = collection_.dataclass;
  // A dataclass new to the share is registered before it is locked: some
  // servers make a file where a missing resource is locked, and one whose
  // workers then remember a file at the collection's path keeps failing
  // writes into the collection for a while.
  if (!listed) session_.getDataclassInfo(dataclass);
  try {
    lockReleasingOwnLeftovers([&] { session_.lockClient(); });
  } catch (const NubiloException& e) {
    if (e.name() != NubiloClientRegistrationException) throw;
    // The share does not know this computer (a new share, or one reset).
    session_.registerClient(session_.configuration().get("guid").string(),
                            session_.configuration().get("ClientName").string());
    session_.lockClient();
  }
  locked_ = true;
  locks_.record();
  try {
    lockReleasingOwnLeftovers([&] { session_.lockDataclass(dataclass); });
  } catch (const NubiloException& e) {
    if (e.name() != NubiloResourceNotFoundException) throw;
    session_.getDataclassInfo(dataclass);  // registers it
    session_.lockDataclass(dataclass);
  }
  locks_.record();
}

void DataclassSync::unlock() {
  locked_ = false;
  session_.unlockDataclass(collection_.dataclass);
  session_.unlockClient();
  locks_.record();
}

DataclassSync::Incoming DataclassSync::fetch(bool slow, const DataclassRecord& record,
                                             const NetworkState& state, const Local& local) {
  const std::string& dataclass = collection_.dataclass;
  Incoming in;
  in.record = record;
  in.state = state;
  in.slow = slow;
  if (slow)
    for (const SyncEngineChange& have : engine_.records(dataclass)) {
      Dictionary fields;
      merge::applyChanges(fields, have.changes());
      in.base.emplace(have.recordIdentifier(), std::move(fields));
    }
  if (!record.maxversion) return in;
  outcome_.mode = slow ? "slow" : "fast";
  const int64_t from = slow ? record.minversion.value_or(1) : in.state.index.value_or(0) + 1;
  const int64_t to = *record.maxversion;
  if (from > to) return in;

  VTCPrefsCenter& prefs = VTCPrefsCenter::defaultCenter();
  if (auto failed = prefs.failedETagForDataclass(dataclass); failed && *failed == record.etag)
    throw SyncFailure(FailureKind::Other,
                      "The server's copy of " + dataclass +
                          " was found damaged and has not changed since; the next sync after "
                          "another computer repairs it will take it in.");
  if (!options_.dryRun) {
    prefs.setDownloadedAnchorClog(Value(from), dataclass);
    const int64_t limit = prefs.configuration().get("max_repeated_downloads").integer();
    if (limit > 0 && prefs.repeatedDownloadCountForDataclass(dataclass) >= limit)
      throw SyncFailure(FailureKind::Other,
                        "The changes of " + dataclass + " from changelog " + std::to_string(from) +
                            " were downloaded " + std::to_string(limit) +
                            " times without the sync completing; the server's copy needs "
                            "repair (see the log).");
  }

  vtc::ChangeLogFetchResult fetched;
  try {
    // In pieces, so that progress can be told between them.
    constexpr int64_t kPiece = 64;
    for (int64_t start = from; start <= to; start += kPiece) {
      report("receiving", static_cast<size_t>(start - from), static_cast<size_t>(to - from + 1),
             fetched.StorageConsumed);
      auto piece =
          session_.fetchChangeLogsForDataclass(dataclass, start, std::min(to, start + kPiece - 1));
      fetched.StorageConsumed += piece.StorageConsumed;
      for (auto& [index, log] : piece.changeLogs) fetched.changeLogs[index] = std::move(log);
      fetched.refusedChangeLogs.merge(piece.refusedChangeLogs);
    }
  } catch (const NubiloException& e) {
    // A server error of the moment is tried again next time; only damage is
    // looked into and remembered.
    if (!showsDamage(e) || options_.dryRun) throw;
    if (!session_.validPropertiesForDataclass(dataclass)) {
      // A record that names changelogs that are not there (a commit cut
      // short): repaired from the files present, then read from minversion.
      VTC_LOG_WARNING("The record of %@ is invalid, repairing it and syncing from minversion",
                      dataclass);
      session_.setInfoForDataclass(session_.calculatePropertiesForDataclass(dataclass), dataclass);
      DataclassRecord repaired = DataclassRecord::fromRecord(session_.getDataclassInfo(dataclass));
      if (!slow || repaired.minversion != record.minversion ||
          repaired.maxversion != record.maxversion)
        return fetch(true, repaired, state, local);
    }
    prefs.setFailedETag(record.etag, dataclass);
    throw;
  }
  outcome_.changelogsFetched = static_cast<int64_t>(fetched.changeLogs.size());
  outcome_.bytesFetched = fetched.StorageConsumed;
  in.fetched = true;
  in.state = NetworkState{to, record.minversion};
  setAsideChangeLogs(fetched.refusedChangeLogs);
  if (fetched.changeLogs.empty()) return in;

  // Fast: each record the changes touch starts from the truth, or from its
  // tombstone when it was deleted here.
  if (!slow) {
    std::set<std::string> touched;
    for (const auto& [index, log] : fetched.changeLogs)
      for (const SyncEngineChange& change : log->changes())
        touched.insert(change.recordIdentifier());
    const std::vector<std::string> ids(touched.begin(), touched.end());
    in.base = engine_.recordsWithIdentifiers(dataclass, ids);
    std::vector<std::string> gone;
    for (const std::string& id : ids)
      if (!in.base.count(id)) gone.push_back(id);
    for (auto& [id, tomb] : engine_.tombstones(dataclass, gone)) {
      merge::FoldState& state = in.folds[id];
      state.buried = std::move(tomb.record);
      state.deletedBy = tomb.origin;
      state.deletedHere = tomb.here;
    }
    for (const auto& [id, fields] : in.base) in.folds[id].record = fields;
  }
  const std::string own = session_.configuration().get("guid").string();
  size_t applied = 0;
  for (const auto& [index, log] : fetched.changeLogs) {
    report("taking in changes", applied++, fetched.changeLogs.size());
    const std::string origin = log->headerValueForKey("CreatorClientName").string();
    const bool here = !own.empty() && log->headerValueForKey("CreatorClientGuid").string() == own;
    for (const SyncEngineChange& change : log->changes()) {
      const std::string& id = change.recordIdentifier();
      merge::foldChange(in.folds[id], change, origin, here);
      in.refusedIds.erase(id);  // a later change to it arrived
      if (isConfirmedDelete(change))
        in.confirmedDeletes.insert(id);
      else
        in.confirmedDeletes.erase(id);
    }
    // A change that could not be read is refused by itself: its record is
    // set aside until a later change to it arrives.
    for (const vtc::RefusedChange& refused : log->refusedChanges()) {
      auto known = in.folds.find(refused.recordIdentifier);
      std::string file = known != in.folds.end() && known->second.record
                             ? recordFile(*known->second.record)
                             : std::string();
      if (file.empty()) file = fileNameFor(refused.recordIdentifier, collection_.kind);
      in.refusedIds.insert(refused.recordIdentifier);
      in.refused.emplace_back(
          refused.recordIdentifier,
          engine::SetAside{file, "its change could not be read: " + refused.reason, origin,
                           currentClock().now()});
    }
  }
  std::erase_if(in.refused, [&](const auto& entry) { return !in.refusedIds.count(entry.first); });
  for (auto& [id, state] : in.folds)
    if (state.changed) ++outcome_.receivedChanges;
  return in;
}

void DataclassSync::setAsideChangeLogs(const std::map<int64_t, RefusedChangeLog>& refused) {
  if (!refused.empty() && !session_.accountSeal())
    throw SyncFailure(FailureKind::Login,
                      "The account's data is encrypted now (changelog " +
                          std::to_string(refused.begin()->first) + " of " + collection_.dataclass +
                          " is); run `nubilosyncclient setup` again to give this computer the "
                          "passphrase.");
  // Nothing of them is known but who the envelope says wrote them.
  for (const auto& [index, log] : refused) {
    std::string origin;
    if (!log.creatorGuid.empty()) try {
        origin = session_.getClientInfo(log.creatorGuid).get("clientname").string();
      } catch (const NubiloException& e) {
        VTC_LOG_WARNING("The computer %@ could not be looked up: %@", log.creatorGuid, e);
      }
    refusedLogs_.push_back({"changelog " + std::to_string(index), log.reason, origin});
  }
}

DataclassSync::Plan DataclassSync::decide(Local& local, Incoming& in,
                                          const DataclassRecord& record) {
  const std::string& dataclass = collection_.dataclass;
  const bool firstCommit = !record.maxversion;
  Plan plan;
  // Every record either side touched; a slow sync and a first commit weigh
  // every record there is.
  std::set<std::string> ids;
  for (const auto& [id, version] : local.versions) ids.insert(id);
  for (const auto& [id, state] : in.folds)
    if (state.changed || in.slow) ids.insert(id);
  if (in.slow)
    for (const auto& [id, fields] : in.base) ids.insert(id);
  if (firstCommit && local.truthCount > 0)
    for (const SyncEngineChange& have : engine_.records(dataclass)) {
      Dictionary fields;
      merge::applyChanges(fields, have.changes());
      ids.insert(have.recordIdentifier());
      in.base.emplace(have.recordIdentifier(), std::move(fields));
    }

  auto find = [](const auto& map, const std::string& id) -> std::optional<Dictionary> {
    auto it = map.find(id);
    if (it == map.end()) return std::nullopt;
    return it->second;
  };
  const Date now = currentClock().now();
  for (const std::string& id : ids) {
    merge::RecordSides sides;
    sides.base = find(local.truth, id);
    if (!sides.base) sides.base = find(in.base, id);
    auto version = local.versions.find(id);
    auto fold = in.folds.find(id);
    const bool local_ = version != local.versions.end();
    sides.ours = local_ ? version->second.record : sides.base;
    sides.changedHere = local.changed.count(id) > 0;
    if (firstCommit) {
      sides.theirs = std::nullopt;  // an empty share: nothing there to weigh
      sides.changedThere = false;
    } else if (in.refusedIds.count(id)) {
      // Its change could not be read: the share's version is taken to be
      // the one last synced, so that nothing here is lost or undone.
      sides.theirs = sides.base;
      sides.changedThere = false;
    } else {
      if (fold != in.folds.end())
        sides.theirs = fold->second.record;
      else if (!in.slow)
        sides.theirs = sides.base;
      sides.changedThere = !merge::sameRecord(sides.theirs, sides.base);
    }
    if (auto f = local.fileNow.find(id); f != local.fileNow.end())
      sides.file = f->second;
    else
      sides.file = sides.base;

    merge::RecordDecision d = merge::decideRecord(collection_.kind, id, sides);
    const std::string origin = fold != in.folds.end() && fold->second.changed
                                   ? fold->second.origin
                                   : options_.computerName;
    plan.origins[id] = origin;
    const std::optional<Dictionary>& merged = d.merged.record;
    if (d.send) {
      if (d.send->type() == SyncEngineChange::kDelete && options_.deletesConfirmed)
        d.send =
            SyncEngineChange(SyncEngineChange::kDelete, id,
                             Array{Value(Dictionary{{"action", "set"},
                                                    {"name", kConfirmedDelete},
                                                    {"value", Value(options_.computerName)}})});
      plan.send.push_back(std::move(*d.send));
    }
    if (d.truthChanged) {
      const bool deletedHere = !merged && sides.changedHere && !sides.ours;
      plan.truth.push_back({id, merged, deletedHere ? options_.computerName : origin, deletedHere});
    }
    if (d.folderTakes) plan.takes.push_back(id);
    if (d.send || d.folderTakes) {
      using Change = ItemActivity::Change;
      auto kind = [](const std::optional<Dictionary>& from, const std::optional<Dictionary>& to) {
        return !to ? Change::Delete : !from ? Change::Add : Change::Edit;
      };
      const Dictionary* shown = nullptr;
      const std::optional<Dictionary>* versions[] = {&merged, &sides.base, &sides.ours,
                                                     &sides.file};
      for (const std::optional<Dictionary>* v : versions)
        if (!shown && *v) shown = &**v;
      if (shown)
        outcome_.items.push_back({displayName(*shown), recordFile(*shown),
                                  d.send ? kind(sides.theirs, merged) : Change::None,
                                  d.folderTakes ? kind(sides.file, merged) : Change::None});
    }
    if (sides.base && !merged && !(sides.changedHere && !sides.ours)) {
      if (in.confirmedDeletes.count(id))
        ++outcome_.confirmedDeletes;
      else
        ++plan.incomingDeletes;
    }

    // What this computer loses: values that lost to the share's, and its
    // deletes undone by edits made elsewhere.
    const Dictionary item = merged ? *merged : sides.base.value_or(Dictionary{});
    const std::string file = recordFile(item);
    const std::string name = displayName(item);
    auto keep = [&](const merge::LostValue& lost, const std::string& keptBy) {
      plan.conflicts.push_back({"", dataclass, id, file, name, lost.key, lost.kept, lost.lost, item,
                                keptBy, options_.computerName, now});
    };
    if (local_)
      for (const merge::LostValue& lost : version->second.lost) keep(lost, options_.computerName);
    for (const merge::LostValue& lost : d.merged.lost) keep(lost, origin);
    const bool undoneHere = (local_ && version->second.deleteUndone) ||
                            (d.merged.deleteUndone && merged) ||
                            (fold != in.folds.end() && fold->second.restored &&
                             fold->second.restoredDeleteWasHere && merged);
    if (undoneHere) {
      ++outcome_.deletesUndone;
      if (!d.merged.deleteUndone && !(local_ && version->second.deleteUndone))
        keep({merge::kRecordField, Value(), Value()}, origin);
    }
  }
  outcome_.conflicts = plan.conflicts.size();
  return plan;
}

void DataclassSync::guardDeletes(const Local& local, const Plan& plan) {
  if (options_.maxDeletePercent >= 100 || plan.incomingDeletes == 0) return;
  const std::string& dataclass = collection_.dataclass;
  const size_t records = static_cast<size_t>(local.truthCount);
  const size_t deletes = plan.incomingDeletes;
  // Emptying the folder is never taken silently, however small it is.
  const bool empties = deletes >= records;
  if (!empties && (deletes <= kDeletesThatAlwaysPass ||
                   deletes * 100 <= records * static_cast<size_t>(options_.maxDeletePercent)))
    return;
  throw SyncFailure(
      FailureKind::DeleteRefused,
      "Syncing " + dataclass + " would delete " + std::to_string(deletes) + " of its " +
          std::to_string(records) + " items here (" + percentText(deletes, records) +
          (empties ? ", every one"
                   : ", more than " + std::to_string(options_.maxDeletePercent) + "%") +
          "); if that is meant, run `nubilosyncclient sync " + dataclass + " --max-delete 100`.");
}

void DataclassSync::commit(Plan& plan, DataclassRecord& record) {
  if (plan.send.empty()) return;
  const std::string& dataclass = collection_.dataclass;
  report("sending", 0, plan.send.size());
  const bool firstCommit = !record.maxversion;
  const int64_t index = firstCommit ? 1 : *record.maxversion + 1;
  // The lock is renewed first: a lock that expired (this computer slept)
  // fails here, before anything is written.
  session_.relockDataclass(dataclass);
  try {
    session_.commitChanges(plan.send, dataclass, index, firstCommit);
  } catch (const NubiloException& e) {
    // A changelog at this index with a record that does not name it: an
    // earlier commit whose record update was lost. The record is set right
    // from the files, so that the next sync takes that changelog in.
    if (e.name() == NubiloServerIncoherencyException) repairLaggingRecord(index);
    throw;
  }
  // The commit does not judge its record update: a lost one would hide this
  // changelog from every other computer, so it is looked at once.
  repairLaggingRecord(index);
  record.maxversion = index;
  if (firstCommit) record.minversion = index;
  outcome_.committedIndex = index;
  if (firstCommit) markOthersNeedingTruth();
}

void DataclassSync::keepConflicts(const Plan& plan) {
  for (const KeptConflict& c : plan.conflicts) {
    VTC_LOG_INFO("Conflict on %@ of record %@ in %@: kept %@ from %@, lost %@ from here", c.field,
                 c.record, c.dataclass, c.kept, c.keptComputer, c.lost);
    conflicts_.keep(c);
  }
}

void DataclassSync::store(Local& local, Plan& plan, const Incoming& incoming) {
  engine::SyncOutcome o;
  o.truth = std::move(plan.truth);
  o.folderTakes = std::move(plan.takes);
  o.setAside = incoming.refused;
  o.networkClient = kNetworkClient;
  o.folderClient = folderClient_;
  NetworkState state = incoming.state;
  if (outcome_.committedIndex)
    state = NetworkState{outcome_.committedIndex, incoming.record.minversion};
  if (incoming.fetched || incoming.stateChanged || outcome_.committedIndex)
    o.network.clientState = state.toValue();
  // The files read are taken in: their states and records go with the
  // truth; a file that holds its record's truth byte for byte keeps none of
  // its own.
  std::map<std::string_view, const std::optional<Dictionary>*> truth;
  for (const engine::SyncOutcome::Entry& entry : o.truth) truth[entry.id] = &entry.record;
  for (const auto& [name, file] : local.folder.scan.read) {
    const ItemState& s = local.folder.scan.states.at(name);
    auto now = local.fileNow.find(s.record);
    if (now == local.fileNow.end() || !now->second) continue;
    const Dictionary* held = nullptr;
    if (auto t = truth.find(s.record); t != truth.end())
      held = *t->second ? &**t->second : nullptr;
    else if (auto l = local.truth.find(s.record); l != local.truth.end())
      held = &l->second;
    o.folder.items.emplace_back(
        name,
        engine::StoredItem{{s.size, s.modifiedNanoseconds, s.changedNanoseconds, s.inode, s.record},
                           held && *held == *now->second ? Value() : Value(*now->second)});
  }
  for (const std::string& name : local.folder.scan.deleted)
    o.folder.items.emplace_back(name, std::nullopt);
  engine_.storeSync(collection_.dataclass, o);
}

void DataclassSync::repairLaggingRecord(int64_t index) {
  const std::string& dataclass = collection_.dataclass;
  DataclassRecord now;
  try {
    now = DataclassRecord::fromRecord(session_.getDataclassInfo(dataclass));
  } catch (const NubiloException& e) {
    // Unreadable now: a later commit runs into the changelog and repairs then.
    VTC_LOG_WARNING("Could not read the record of %@ after a commit: %@", dataclass, e);
    return;
  }
  if (now.maxversion && *now.maxversion >= index) return;
  VTC_LOG_WARNING("The record of %@ names changelog %@ while %d is on the share; repairing it",
                  dataclass, now.maxversion.value_or(0), index);
  session_.setInfoForDataclass(session_.calculatePropertiesForDataclass(dataclass), dataclass);
}

void DataclassSync::markOthersNeedingTruth() {
  lockReleasingOwnLeftovers([&] { session_.lockClients(); });
  locks_.record();
  try {
    session_.setOtherClientStatus("needstruth", collection_.dataclass);
  } catch (...) {
    session_.unlockClients();
    throw;
  }
  session_.unlockClients();
  locks_.record();
}

std::string DataclassSync::truthDigestText() {
  const std::map<std::string, engine::SetAside> aside =
      engine_.setAsideRecords(collection_.dataclass);
  uint64_t digest = 0;
  engine_.forEachRecord(collection_.dataclass, [&](const std::string& id, const Dictionary& r) {
    if (!aside.count(id)) digest ^= recordDigest(id, r);
  });
  return format("%016llx", static_cast<unsigned long long>(digest));
}

bool DataclassSync::compactionDue(const DataclassRecord& record) {
  if (!record.maxversion) return false;  // the first commit is the whole truth
  const std::string& dataclass = collection_.dataclass;
  const int64_t min = record.minversion.value_or(1);
  const int64_t count = *record.maxversion - min + 1;
  if (count <= 1) return false;
  // A count bounds how many changelogs a computer that was away fetches.
  int64_t maxCount = session_.configuration().get("compaction_max_changelogs").integer();
  if (maxCount <= 0) maxCount = 1024;
  if (count > maxCount) return true;
  // By bytes: once the changes after the last whole truth outweigh it, it is
  // written again, so the history never holds much more than twice the data
  // (or a small history) and its cost follows the changes.
  int64_t chain = 0, truth = 0;
  DavTransaction listing =
      session_.tesselSession().listCollectionAtPath(session_.schemasPath() + "/" + dataclass);
  for (const Value& entry : listing.result().array()) {
    const std::string& uri = entry.dictionary().get(kNBURI).string();
    if (!uri.ends_with(".clog")) continue;
    const int64_t size = entry.dictionary().get(kNBContentLength).integer();
    if (uri == session_.changeLogPathForDataclass(dataclass, min))
      truth = size;
    else
      chain += size;
  }
  constexpr int64_t kSmallHistory = 64 * 1024;
  return truth > 0 && chain > std::max(truth, kSmallHistory);
}

void DataclassSync::compact(DataclassRecord& record, Incoming& incoming) {
  // The truth at the share's last changelog: this computer's, with what the
  // changelogs just taken in made of each record (a slow sync's truth is
  // theirs alone), without the records set aside here (they make no item
  // anywhere).
  const std::string& dataclass = collection_.dataclass;
  const std::map<std::string, engine::SetAside> aside = engine_.setAsideRecords(dataclass);
  std::vector<SyncEngineChange> whole;
  uint64_t digest = 0;
  auto add = [&](const std::string& id, const Dictionary& r) {
    if (aside.count(id)) return;
    digest ^= recordDigest(id, r);
    whole.emplace_back(SyncEngineChange::kAdd, id, merge::recordSets(r));
  };
  if (!incoming.slow)
    engine_.forEachRecord(dataclass, [&](const std::string& id, const Dictionary& r) {
      if (!incoming.folds.count(id)) add(id, r);
    });
  for (const auto& [id, fold] : incoming.folds)
    if (fold.record) add(id, *fold.record);
  const int64_t truthIndex = *record.maxversion;
  writeTruth(record, whole);
  session_.setInfoForDataclass(
      Dictionary{{"truthdigest", Value(format("%d:%016llx", truthIndex,
                                              static_cast<unsigned long long>(digest)))}},
      dataclass);
  incoming.state = NetworkState{record.minversion, record.minversion};
  incoming.stateChanged = true;
}

void DataclassSync::repair(DataclassRecord& record) {
  const std::map<std::string, engine::SetAside> aside =
      engine_.setAsideRecords(collection_.dataclass);
  std::vector<SyncEngineChange> whole = engine_.records(collection_.dataclass);
  std::erase_if(whole,
                [&](const SyncEngineChange& c) { return aside.count(c.recordIdentifier()) > 0; });
  writeTruth(record, whole);
  engine::StateUpdate state;
  state.clientState = NetworkState{record.minversion, record.minversion}.toValue();
  engine_.saveState(kNetworkClient, collection_.dataclass, state);
  outcome_.committedIndex = record.maxversion;
}

void DataclassSync::writeTruth(DataclassRecord& record,
                               const std::vector<SyncEngineChange>& whole) {
  // The whole truth as a reset commit; every other computer then takes it
  // in once (or, holding it already, goes on from it), and the changelogs
  // before it go.
  const std::string& dataclass = collection_.dataclass;
  const int64_t min = record.minversion.value_or(1);
  const int64_t max = record.maxversion.value_or(0);
  VTC_LOG_INFO("Compacting %@: %d changelogs from %d", dataclass, max - min + 1, min);
  const int64_t index = max + 1;
  session_.relockDataclass(dataclass);
  session_.commitChanges(whole, dataclass, index, true);
  markOthersNeedingTruth();
  const auto halfLock = std::chrono::duration_cast<Date::duration>(
      std::chrono::duration<double>(session_.lockDuration() / 2.0));
  Date renewBy = currentClock().now() + halfLock;
  for (int64_t old = min; old <= max; ++old) {
    if (currentClock().now() > renewBy) {
      session_.relockDataclass(dataclass);
      session_.relockClient();
      renewBy = currentClock().now() + halfLock;
    }
    // A leftover old changelog is outside the record's range; the next sync
    // that finds one removes it.
    session_.tesselSession().deleteResourceAtPath(
        session_.changeLogPathForDataclass(dataclass, old));
  }
  record.minversion = index;
  record.maxversion = index;
  outcome_.compacted = true;
}

void DataclassSync::writeFolder(const std::map<std::string, std::string>* origins,
                                std::map<std::string, ItemState>* known) {
  FolderWriter writer{folder_, engine_,           folderClient_, collection_.dataclass,
                      origins, options_.progress, known};
  FolderWriteResult written = writer.write();
  outcome_.filesWritten += written.written;
  outcome_.filesSkipped += written.skipped;
  outcome_.writeFailures = std::move(written.failures);
  // Every record still set aside is named, every sync, until a change to it
  // makes it an item again.
  outcome_.setAside.clear();
  for (const auto& [id, item] : engine_.setAsideRecords(collection_.dataclass))
    outcome_.setAside.push_back({item.file, item.reason, item.origin});
  outcome_.setAside.insert(outcome_.setAside.end(), refusedLogs_.begin(), refusedLogs_.end());
}

}  // namespace vtc::client
