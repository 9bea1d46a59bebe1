#include "client/run/DataclassSync.h"

#include <chrono>
#include <functional>
#include <set>

#include "VantorSyncManager/NubiloException.h"
#include "VantorSyncManager/PublicNames.h"
#include "VantorSyncManager/VTCPrefsCenter.h"
#include "client/run/FailureText.h"
#include "client/run/SyncFailure.h"
#include "common/Clock.h"
#include "common/Logging.h"
#include "platform/dav/TesselSession.h"

namespace vtc::client {

namespace {

Array setsOf(const Dictionary& fields) {
  Array sets;
  for (const auto& [name, value] : fields)
    sets.push_back(Value(Dictionary{{"action", "set"}, {"name", name}, {"value", value}}));
  return sets;
}

// The property changes that turn `from` into `to`, leaving out names in skip.
Array differences(const Dictionary& from, const Dictionary& to,
                  const std::set<std::string>& skip = {}) {
  Array changes;
  for (const auto& [name, value] : to) {
    if (skip.count(name)) continue;
    const Value* old = from.find(name);
    if (!old || !(*old == value))
      changes.push_back(Value(Dictionary{{"action", "set"}, {"name", name}, {"value", value}}));
  }
  for (const auto& [name, value] : from)
    if (!to.contains(name) && !skip.count(name))
      changes.push_back(Value(Dictionary{{"action", "clear"}, {"name", name}}));
  return changes;
}

void apply(Dictionary& fields, const Array& changes) {
  for (const Value& pc : changes) {
    const Dictionary& d = pc.dictionary();
    if (d.get("action").string() == "set")
      fields.set(d.get("name").string(), d.get("value"));
    else
      fields.erase(d.get("name").string());
  }
}

// What the engine keeps of the folder's files: their stamps, with the
// fields of each left empty until they are needed.
std::map<std::string, ItemState> knownFiles(engine::SyncEngine& engine, const std::string& client,
                                            const std::string& dataclass) {
  std::map<std::string, ItemState> known;
  for (const auto& [name, stamp] : engine.itemStamps(client, dataclass)) {
    ItemState state;
    state.size = stamp.size;
    state.modifiedNanoseconds = stamp.modified;
    state.changedNanoseconds = stamp.changed;
    state.inode = stamp.inode;
    known.emplace_hint(known.end(), name, std::move(state));
  }
  return known;
}

engine::StoredItem stored(const ItemState& state) {
  return {{state.size, state.modifiedNanoseconds, state.changedNanoseconds, state.inode},
          Value(state.fields)};
}

// The delete guard looks at proportions only from this many deletes on.
constexpr size_t kDeletesThatAlwaysPass = 2;

std::string percentText(size_t part, size_t whole) {
  return std::to_string(whole ? part * 100 / whole : 0) + "%";
}

}  // namespace

std::string folderClient(const std::string& dataclass) {
  return "vdir:" + dataclass;
}

struct DataclassSync::Remote {
  DataclassRecord record;
  NetworkState state;
  bool slow = false;
  std::map<int64_t, std::unique_ptr<NubiloChangeLog>> changelogs;
  std::map<std::string, Dictionary> truth;  // slow: the records the changelogs add up to
  // Slow: records of the truth known only from modifies (deleted before the
  // first changelog read): their other fields are this computer's.
  std::set<std::string> partial;
  std::map<std::string, std::string> origins;  // slow: the computer that last changed each record
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

engine::PushOptions DataclassSync::pushOptions(const std::string& origin,
                                               engine::StateUpdate state) {
  engine::PushOptions options;
  options.origin = origin;
  options.state = std::move(state);
  options.onConflict = [this](const engine::Conflict& conflict) { noteConflict(conflict); };
  return options;
}

void DataclassSync::noteConflict(const engine::Conflict& conflict) {
  ++outcome_.conflicts;
  if (!options_.dryRun) conflicts_.keep(conflict);
}

void DataclassSync::report(const char* what, size_t done, size_t total, int64_t bytes) {
  if (options_.progress) options_.progress->step(collection_.dataclass, what, done, total, bytes);
}

DataclassOutcome DataclassSync::run(const std::optional<DataclassRecord>& listed) {
  const std::string& dataclass = collection_.dataclass;
  if (!folder_.exists())
    throw SyncFailure(FailureKind::Other,
                      "The folder " + collection_.folder + " of " + dataclass +
                          " is missing; create it, or stop syncing it with `nubilosyncclient "
                          "remove " +
                          dataclass + "`.");

  // The folder, read before anything is written anywhere. Only files whose
  // stamps changed are read; their fields are then compared with the fields
  // last seen, which are loaded for them alone.
  std::map<std::string, ItemState> known = knownFiles(engine_, folderClient_, dataclass);
  const size_t knownCount = known.size();
  report("reading the folder", 0, knownCount);
  const ScanResult scan = folder_.scan(std::move(known));
  std::vector<std::string> reread;
  for (const auto& [name, fields] : scan.changed) reread.push_back(name);
  std::map<std::string, Dictionary> lastFields;
  for (auto& [name, detail] : engine_.itemDetails(folderClient_, dataclass, reread))
    lastFields.emplace(name, detail.dictionary());
  outcome_.invalidFiles = scan.invalid.size();
  checkLocalDeletes(scan, knownCount);
  const std::vector<SyncEngineChange> local = folderChanges(scan, lastFields);
  engine::StateUpdate scanned;
  for (const auto* read : {&scan.added, &scan.changed})
    for (const auto& [name, fields] : *read)
      scanned.items.emplace_back(name, stored(scan.states.at(name)));
  for (const std::string& name : scan.deleted) scanned.items.emplace_back(name, std::nullopt);

  const NetworkState network =
      NetworkState::fromValue(engine_.clientState(kNetworkClient, dataclass));
  const bool unsent = !local.empty() || !engine_.pull(kNetworkClient, dataclass).changes.empty();
  const bool serverMoved =
      listed && (listed->maxversion != network.index || listed->minversion != network.minversion);
  const bool serverLacksData =
      (!listed || !listed->maxversion) && (unsent || engine_.recordCount(dataclass) > 0);

  if (!unsent && !serverMoved && !serverLacksData && !options_.repair) {
    if (!scanned.empty()) engine_.saveState(folderClient_, dataclass, scanned);
    writeFolder();
    return outcome_;
  }

  outcome_.usedServer = true;
  if (!options_.dryRun) lock(listed.has_value());
  try {
    Remote remote;
    remote.state = network;
    // Read again under the lock: the listing may be older than the lock.
    remote.record = options_.dryRun
                        ? listed.value_or(DataclassRecord{})
                        : DataclassRecord::fromRecord(session_.getDataclassInfo(dataclass));
    bool needsTruth = false;
    if (!options_.dryRun) {
      const Value status = session_.getClientInfo().get(dataclass + ".status");
      needsTruth = status.isString() && status.string() == "needstruth";
    }
    if (options_.repair && remote.record.maxversion && network.index != remote.record.maxversion)
      throw SyncFailure(FailureKind::Other,
                        "This computer has not taken in every change of " + dataclass +
                            " yet, so its copy cannot repair the share's; repair on a "
                            "computer whose last sync of it succeeded.");
    const bool slow = !options_.repair && remote.record.maxversion &&
                      (!network.index || remote.record.minversion != network.minversion ||
                       *remote.record.maxversion < *network.index || needsTruth);
    remote = fetch(slow, remote.record);

    engine_.push(folderClient_, dataclass, local, pushOptions(options_.computerName, scanned));
    applyRemote(remote, engine_.pull(kNetworkClient, dataclass), lastFields);
    commit(remote);
    compactIfLong(remote);
    if (needsTruth && !options_.dryRun)
      session_.setStatus("normal", session_.configuration().get("guid").string(), dataclass);
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
  writeFolder();
  return outcome_;
}

std::vector<SyncEngineChange> DataclassSync::folderChanges(
    const ScanResult& scan, const std::map<std::string, Dictionary>& lastFields) {
  std::vector<SyncEngineChange> changes;
  for (const auto& [name, fields] : scan.added)
    changes.emplace_back(SyncEngineChange::kAdd, name, setsOf(fields));
  for (const auto& [name, fields] : scan.changed) {
    auto old = lastFields.find(name);
    Array diff = differences(old == lastFields.end() ? Dictionary{} : old->second, fields);
    if (!diff.empty()) changes.emplace_back(SyncEngineChange::kModify, name, std::move(diff));
  }
  for (const std::string& name : scan.deleted)
    changes.emplace_back(SyncEngineChange::kDelete, name, Array{});
  return changes;
}

void DataclassSync::checkLocalDeletes(const ScanResult& scan, size_t known) {
  // A few deletes always pass: deleting one of two contacts is no accident.
  if (known <= kDeletesThatAlwaysPass || options_.maxDeletePercent >= 100) return;
  const std::string& dataclass = collection_.dataclass;
  if (scan.states.empty() && scan.invalid.empty())
    throw SyncFailure(FailureKind::DeleteRefused,
                      "The folder " + collection_.folder + " of " + dataclass +
                          " is empty but held " + std::to_string(known) +
                          " items; if they are meant to go everywhere, run `nubilosyncclient "
                          "sync " +
                          dataclass + " --max-delete 100`.");
  if (scan.deleted.size() > kDeletesThatAlwaysPass &&
      scan.deleted.size() * 100 > known * static_cast<size_t>(options_.maxDeletePercent))
    throw SyncFailure(FailureKind::DeleteRefused,
                      "Syncing " + dataclass + " would delete " +
                          std::to_string(scan.deleted.size()) + " of its " + std::to_string(known) +
                          " items on the other computers (" +
                          percentText(scan.deleted.size(), known) + ", more than " +
                          std::to_string(options_.maxDeletePercent) +
                          "%); if that is meant, run `nubilosyncclient sync " + dataclass +
                          " --max-delete 100`.");
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
      if (own.empty() || lock.get("clientid").string() != own) continue;
      VTC_LOG_WARNING("Giving back a lock of this computer left on %@", path);
      session_.tesselSession().unlockResourceWithToken(path, lock.get("token").string());
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

DataclassSync::Remote DataclassSync::fetch(bool slow, const DataclassRecord& record) {
  const std::string& dataclass = collection_.dataclass;
  Remote remote;
  remote.record = record;
  remote.state = NetworkState::fromValue(engine_.clientState(kNetworkClient, dataclass));
  remote.slow = slow;
  if (!record.maxversion) return remote;
  outcome_.mode = slow ? "slow" : "fast";
  const int64_t from = slow ? record.minversion.value_or(1) : remote.state.index.value_or(0) + 1;
  const int64_t to = *record.maxversion;
  if (from > to) return remote;

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
        return fetch(true, repaired);
    }
    prefs.setFailedETag(record.etag, dataclass);
    throw;
  }
  outcome_.changelogsFetched = static_cast<int64_t>(fetched.changeLogs.size());
  outcome_.bytesFetched = fetched.StorageConsumed;
  remote.changelogs = std::move(fetched.changeLogs);

  // The delete guard for what comes in, before anything is written.
  size_t deletes = 0;
  const int64_t records = engine_.recordCount(dataclass);
  if (slow) {
    // A modify of a deleted record (its editor had not seen the delete)
    // brings it back whole, as it was when deleted: the engine does the same
    // with its tombstones when changes come one changelog at a time.
    std::map<std::string, Dictionary> buried;
    for (const auto& [index, log] : remote.changelogs) {
      const std::string origin = log->headerValueForKey("CreatorClientName").string();
      for (const SyncEngineChange& change : log->changes()) {
        const std::string& id = change.recordIdentifier();
        remote.origins[id] = origin;
        auto it = remote.truth.find(id);
        if (change.type() == SyncEngineChange::kDelete) {
          // Only a whole record is kept aside: a partial one edited again
          // is partial again.
          if (it != remote.truth.end()) {
            if (!remote.partial.erase(id)) buried[id] = std::move(it->second);
            remote.truth.erase(it);
          }
          continue;
        }
        if (change.type() == SyncEngineChange::kAdd) {
          remote.truth[id] = Dictionary{};
          remote.partial.erase(id);
        } else if (it == remote.truth.end()) {
          if (auto b = buried.find(id); b != buried.end())
            remote.truth[id] = std::move(b->second);
          else
            remote.partial.insert(id);
        }
        buried.erase(id);
        apply(remote.truth[id], change.changes());
      }
    }
    for (const SyncEngineChange& have : engine_.records(dataclass))
      if (!remote.truth.count(have.recordIdentifier())) ++deletes;
  } else {
    std::set<std::string> deleted;
    for (const auto& [index, log] : remote.changelogs)
      for (const SyncEngineChange& change : log->changes())
        if (change.type() == SyncEngineChange::kDelete) deleted.insert(change.recordIdentifier());
    deletes = deleted.size();
  }
  if (deletes > kDeletesThatAlwaysPass &&
      deletes * 100 > static_cast<size_t>(records) * static_cast<size_t>(options_.maxDeletePercent))
    throw SyncFailure(FailureKind::DeleteRefused,
                      "Syncing " + dataclass + " would delete " + std::to_string(deletes) +
                          " of its " + std::to_string(records) + " items here (" +
                          percentText(deletes, static_cast<size_t>(records)) + ", more than " +
                          std::to_string(options_.maxDeletePercent) +
                          "%); if that is meant, run `nubilosyncclient sync " + dataclass +
                          " --max-delete 100`.");
  return remote;
}

void DataclassSync::applyRemote(Remote& remote, const engine::PullResult& pending,
                                const std::map<std::string, Dictionary>& lastFields) {
  const std::string& dataclass = collection_.dataclass;
  if (remote.changelogs.empty()) return;
  const int64_t last = remote.changelogs.rbegin()->first;
  if (!remote.slow) {
    size_t applied = 0;
    for (const auto& [index, log] : remote.changelogs) {
      report("taking in changes", applied++, remote.changelogs.size());
      const std::vector<SyncEngineChange>& changes = log->changes();
      std::string origin = log->headerValueForKey("CreatorClientName").string();
      NetworkState after{index, remote.record.minversion};
      engine::StateUpdate state;
      state.clientState = after.toValue();
      engine_.push(kNetworkClient, dataclass, changes, pushOptions(origin, state));
      outcome_.receivedChanges += changes.size();
    }
    remote.state = NetworkState{last, remote.record.minversion};
    return;
  }

  // Slow: the engine takes the truth, except where an edit of this computer
  // has not been sent yet: those records and fields keep the local value.
  std::set<std::string> pendingRecords;
  std::map<std::string, std::set<std::string>> pendingFields;
  for (const SyncEngineChange& change : pending.changes) {
    pendingRecords.insert(change.recordIdentifier());
    for (const Value& pc : change.changes())
      pendingFields[change.recordIdentifier()].insert(pc.dictionary().get("name").string());
  }
  std::map<std::string, Dictionary> current;
  for (const SyncEngineChange& have : engine_.records(dataclass)) {
    Dictionary fields;
    apply(fields, have.changes());
    current.emplace(have.recordIdentifier(), std::move(fields));
  }
  std::vector<SyncEngineChange> diff;
  for (const auto& [id, fields] : remote.truth) {
    auto here = current.find(id);
    const bool partial = remote.partial.count(id);
    if (here == current.end()) {
      // Not deleted here since the last sync: added, or for a partial record
      // modified, so that the engine brings back the rest from its tombstone.
      if (!pendingRecords.count(id))
        diff.emplace_back(partial ? SyncEngineChange::kModify : SyncEngineChange::kAdd, id,
                          setsOf(fields));
      continue;
    }
    // A field edited here that the share changed too since this computer
    // last saw it: the value of here stays and is sent; the share's is kept
    // as the loser, as when the changes come one changelog at a time.
    if (auto seen = lastFields.find(id); seen != lastFields.end())
      for (const std::string& name : pendingFields[id]) {
        const Value &base = seen->second.get(name), &theirs = fields.get(name),
                    &ours = here->second.get(name);
        if (theirs == base || theirs == ours) continue;
        VTC_LOG_INFO("Conflict on %@ of record %@ in %@: kept %@ from here, dropped %@ from %@",
                     name, id, dataclass, ours, theirs, remote.origins[id]);
        noteConflict({dataclass, id, name, ours, theirs, folderClient_, kNetworkClient,
                      options_.computerName, remote.origins[id], currentClock().now()});
      }
    Dictionary from = here->second;
    if (partial)  // only the fields the changelogs set; the rest stays as it is here
      for (const std::string& name : here->second.keys())
        if (!fields.contains(name)) from.erase(name);
    Array changes = differences(from, fields, pendingFields[id]);
    if (!changes.empty()) diff.emplace_back(SyncEngineChange::kModify, id, std::move(changes));
  }
  for (const auto& [id, fields] : current)
    if (!remote.truth.count(id) && !pendingRecords.count(id))
      diff.emplace_back(SyncEngineChange::kDelete, id, Array{});
  engine::StateUpdate state;
  remote.state = NetworkState{last, remote.record.minversion};
  state.clientState = remote.state.toValue();
  engine_.push(kNetworkClient, dataclass, diff, pushOptions("", state));
  outcome_.receivedChanges += diff.size();
}

void DataclassSync::commit(Remote& remote) {
  const std::string& dataclass = collection_.dataclass;
  engine::PullResult pending = engine_.pull(kNetworkClient, dataclass);
  const bool firstCommit = !remote.record.maxversion;
  std::vector<SyncEngineChange> changes =
      firstCommit ? engine_.records(dataclass) : std::move(pending.changes);
  engine::StateUpdate state;
  if (changes.empty()) {
    state.clientState = remote.state.toValue();
    if (!options_.dryRun) engine_.acknowledge(kNetworkClient, dataclass, pending.anchor, state);
    return;
  }
  outcome_.sentChanges = changes.size();
  if (options_.dryRun) return;
  report("sending", 0, changes.size());
  const int64_t index = firstCommit ? 1 : *remote.record.maxversion + 1;
  // The lock is renewed first: a lock that expired (this computer slept)
  // fails here, before anything is written.
  session_.relockDataclass(dataclass);
  try {
    session_.commitChanges(changes, dataclass, index, firstCommit);
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
  remote.record.maxversion = index;
  if (firstCommit) remote.record.minversion = index;
  remote.state = NetworkState{index, remote.record.minversion};
  state.clientState = remote.state.toValue();
  engine_.acknowledge(kNetworkClient, dataclass, pending.anchor, state);
  outcome_.committedIndex = index;
  if (firstCommit) markOthersNeedingTruth();
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

void DataclassSync::compactIfLong(Remote& remote) {
  if (options_.dryRun || (!outcome_.committedIndex && !options_.repair)) return;
  if (!remote.record.maxversion) return;  // the first commit was the whole truth
  const std::string& dataclass = collection_.dataclass;
  const Dictionary& configuration = session_.configuration();
  const int64_t min = remote.record.minversion.value_or(1);
  const int64_t max = *remote.record.maxversion;
  const int64_t count = max - min + 1;
  int64_t maxCount = configuration.get("compaction_max_changelogs").integer();
  if (maxCount <= 0) maxCount = 64;
  int64_t sizeFactor = configuration.get("compaction_size_factor").integer();
  if (sizeFactor <= 0) sizeFactor = 4;
  bool compact = options_.repair || count > maxCount;
  if (!compact && count >= 8) {
    // Bytes against the size of the data: the oldest changelog is the last
    // whole truth that was written.
    int64_t chain = 0, truth = 0;
    DavTransaction listing =
        session_.tesselSession().listCollectionAtPath(session_.schemasPath() + "/" + dataclass);
    for (const Value& entry : listing.result().array()) {
      const std::string& uri = entry.dictionary().get(kNBURI).string();
      if (!uri.ends_with(".clog")) continue;
      const int64_t size = entry.dictionary().get(kNBContentLength).integer();
      chain += size;
      if (uri == session_.changeLogPathForDataclass(dataclass, min)) truth = size;
    }
    compact = chain > sizeFactor * std::max<int64_t>(truth, 64 * 1024);
  }
  if (!compact) return;

  // The whole truth as a reset commit; every other computer then takes it
  // in once, and the changelogs before it go.
  VTC_LOG_INFO("Compacting %@: %d changelogs from %d", dataclass, count, min);
  const int64_t index = max + 1;
  session_.relockDataclass(dataclass);
  session_.commitChanges(engine_.records(dataclass), dataclass, index, true);
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
    // Not tested: a leftover old changelog is outside the record's range
    // and never read again.
    session_.tesselSession().deleteResourceAtPath(
        session_.changeLogPathForDataclass(dataclass, old));
  }
  remote.record.minversion = index;
  remote.record.maxversion = index;
  remote.state = NetworkState{index, index};
  engine::StateUpdate state;
  state.clientState = remote.state.toValue();
  engine_.saveState(kNetworkClient, dataclass, state);
  outcome_.compacted = true;
  outcome_.committedIndex = index;
}

void DataclassSync::writeFolder() {
  const std::string& dataclass = collection_.dataclass;
  engine::PullResult pulled = engine_.pull(folderClient_, dataclass);
  if (pulled.changes.empty() && !pulled.isTruth) {
    if (!options_.dryRun && pulled.anchor > 0)
      engine_.acknowledge(folderClient_, dataclass, pulled.anchor);
    return;
  }
  std::map<std::string, ItemState> known = knownFiles(engine_, folderClient_, dataclass);
  const std::string extension = itemExtension(collection_.kind);
  engine::StateUpdate states;
  bool skipped = false;
  std::set<std::string> named;
  // Made durable together at the end, before the engine hears of them.
  folder_.deferFlushes(true);
  size_t handled = 0;
  for (const SyncEngineChange& change : pulled.changes) {
    if ((handled++ & 63) == 0) report("writing files", handled - 1, pulled.changes.size());
    const std::string& name = change.recordIdentifier();
    named.insert(name);
    // A name from another computer becomes a file name here: only a plain
    // name of this kind's files is taken.
    if (name.empty() || name.front() == '.' || name.find('/') != std::string::npos ||
        name.find('\0') != std::string::npos || !name.ends_with(extension) || name.size() > 255) {
      VTC_LOG_WARNING("Skipping record %@ of %@: not a file name for this folder", name, dataclass);
      continue;
    }
    ++outcome_.filesWritten;
    if (options_.dryRun) continue;
    auto have = known.find(name);
    const std::optional<ItemState> expected =
        have == known.end() ? std::nullopt : std::optional<ItemState>(have->second);
    WriteOutcome result;
    ItemState written;
    if (change.type() == SyncEngineChange::kDelete) {
      if (!expected) {
        --outcome_.filesWritten;
        continue;
      }
      result = folder_.remove(name, *expected);
      if (result == WriteOutcome::Removed) states.items.emplace_back(name, std::nullopt);
    } else {
      std::optional<std::string> current;
      if (change.type() == SyncEngineChange::kModify && expected) {
        current = folder_.read(name);
        if (!current) {
          skipped = true;
          ++outcome_.filesSkipped;
          --outcome_.filesWritten;
          continue;
        }
      }
      const std::string bytes = applyFieldChanges(collection_.kind, current, change.changes());
      result = folder_.write(name, bytes, expected, &written);
      if (result == WriteOutcome::Written) states.items.emplace_back(name, stored(written));
    }
    if (result == WriteOutcome::SkippedChangedOnDisk || result == WriteOutcome::Failed) {
      // Left for the next sync, which reads the file's new content first.
      VTC_LOG_WARNING("%@ of %@ changed while syncing; it is left for the next sync", name,
                      dataclass);
      skipped = true;
      ++outcome_.filesSkipped;
      --outcome_.filesWritten;
    }
  }
  if (pulled.isTruth) {
    for (const auto& [name, state] : known) {
      if (named.count(name)) continue;
      ++outcome_.filesWritten;
      if (options_.dryRun) continue;
      if (folder_.remove(name, state) == WriteOutcome::Removed)
        states.items.emplace_back(name, std::nullopt);
      else
        skipped = true;
    }
  }
  if (options_.dryRun) return;
  if (!folder_.flush()) {
    // Nothing is recorded: the next sync writes these files again.
    ++outcome_.filesSkipped;
    return;
  }
  // Acknowledged only when every change reached its file: otherwise the
  // next pull brings them again (rewriting a file with the same bytes).
  if (skipped)
    engine_.saveState(folderClient_, dataclass, states);
  else
    engine_.acknowledge(folderClient_, dataclass, pulled.anchor, states);
}

}  // namespace vtc::client
