// The sync of one dataclass between its vdir folder, this computer's
// engine and the share. The folder is read first (only files whose stamps
// changed); the changelogs other computers committed come in (from where
// this computer left off, or from minversion as a slow sync after a reset,
// for a new computer or a damaged record); every record touched on either
// side is decided by the merge rules (client/merge); what the share lacks
// goes out as one changelog; then the engine stores the new truth with the
// folder's states in one transaction, and the folder takes in what it
// lacks. Nothing is stored before the commit succeeded, so a sync that
// fails or is killed leaves the next one to find the same edits again.
// The delete guard runs before anything is written anywhere; a dry run
// writes nothing at all.
#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "VantorSyncManager/NubiloRemoteSession.h"
#include "client/merge/IncomingFold.h"
#include "client/merge/RecordDecision.h"
#include "client/run/Collections.h"
#include "client/run/ConflictStore.h"
#include "client/run/FolderRead.h"
#include "client/run/FolderWrite.h"
#include "client/run/HeldLocks.h"
#include "client/run/Progress.h"
#include "client/run/ServerView.h"
#include "client/stores/VdirCollection.h"
#include "platform/engine/SyncEngine.h"

namespace vtc::client {

struct SyncOptions {
  bool dryRun = false;
  int maxDeletePercent = 50;
  // The user gave --max-delete: deletes this run sends go out as confirmed,
  // and the other computers apply them without asking again.
  bool deletesConfirmed = false;
  std::string computerName;  // this computer, named in conflicts
  // Write this computer's whole truth as a reset commit (a damaged history
  // is then never read again); only a computer whose last sync of the
  // dataclass succeeded and that took in every changelog may.
  bool repair = false;
  Progress* progress = nullptr;  // told how far the sync has come, when set
};

// What a sync did (or, in a dry run, would do) to one item: the change the
// share takes and the change its file here takes.
struct ItemActivity {
  enum class Change { None, Add, Edit, Delete };
  std::string name;  // the contact's or event's name (FN or SUMMARY), else its file name
  std::string file;
  Change sent = Change::None;
  Change here = Change::None;
};

struct DataclassOutcome {
  std::string dataclass;
  std::string mode = "none";   // "none", "fast" or "slow"
  size_t sentChanges = 0;      // committed (or, in a dry run, that would be)
  size_t receivedChanges = 0;  // records the share's changes touched
  size_t filesWritten = 0;     // written, renamed or removed (or that would be)
  size_t filesSkipped = 0;     // changed on disk meanwhile: left for the next sync
  std::vector<std::pair<std::string, std::string>> invalidFiles;  // file, why
  std::vector<SetAsideItem> setAside;
  std::vector<std::string> writeFailures;  // files that could not be written, and why
  size_t conflicts = 0;
  size_t deletesUndone = 0;     // deletes made here that an edit elsewhere undid
  size_t confirmedDeletes = 0;  // deletes confirmed on another computer, applied here
  int64_t changelogsFetched = 0;
  int64_t bytesFetched = 0;
  bool usedServer = false;  // locked, fetched or committed
  bool compacted = false;
  std::optional<int64_t> committedIndex;
  std::vector<ItemActivity> items;  // every item sent or written, in identity order
  std::vector<std::string> notes;   // sentences the user is told (a lock taken over)
  // Items were left over: skipped, set aside or not written.
  bool leftOver() const {
    return !invalidFiles.empty() || !setAside.empty() || !writeFailures.empty();
  }
};

// The network side's client in the engine, and a folder's.
inline constexpr const char* kNetworkClient = "com.korvo.VantorSync";
std::string folderClient(const std::string& dataclass);

class DataclassSync {
 public:
  DataclassSync(NubiloRemoteSession& session, engine::SyncEngine& engine,
                const Collection& collection, const SyncOptions& options, ConflictStore& conflicts,
                HeldLocks& locks);

  // listed: the dataclass's record from the server view (none: not on the
  // share). Raises SyncFailure or the library's failures.
  DataclassOutcome run(const std::optional<DataclassRecord>& listed);
  // What the run got to, also after a failure.
  const DataclassOutcome& outcome() const { return outcome_; }

 private:
  struct Local;     // the folder's side of one run
  struct Incoming;  // the share's side
  struct Plan;      // what the run decided

  Local readLocal();
  // Locks this client and the dataclass (registering them where the share
  // lacks them); listed: whether the share's listing showed the dataclass.
  void lock(bool listed);
  void lockReleasingOwnLeftovers(const std::function<void()>& lockOperation);
  void unlock();
  // state: what the network side has taken in.
  Incoming fetch(bool slow, const DataclassRecord& record, const NetworkState& state,
                 const Local& local);
  // The digest of this computer's truth, without the records set aside:
  // what a compaction of it writes to the share.
  std::string truthDigestText();
  Plan decide(Local& local, Incoming& incoming, const DataclassRecord& record);
  void guardDeletes(const Local& local, const Plan& plan);
  void commit(Plan& plan, DataclassRecord& record);
  void store(Local& local, Plan& plan, const Incoming& incoming);
  void keepConflicts(const Plan& plan);
  // Whether the history has grown long enough to be written again whole.
  bool compactionDue(const DataclassRecord& record);
  // Writes the share's truth at its last changelog as a reset, with its
  // digest in the record; incoming's state then starts from it.
  void compact(DataclassRecord& record, Incoming& incoming);
  // Writes this computer's whole truth as a reset (repair).
  void repair(DataclassRecord& record);
  void writeTruth(DataclassRecord& record, const std::vector<SyncEngineChange>& whole);
  // Sets the record right when it names a changelog below index.
  void repairLaggingRecord(int64_t index);
  // After a reset commit: every other computer takes the truth in once.
  void markOthersNeedingTruth();
  // known: the folder's item states as stored (none: read them).
  void writeFolder(const std::map<std::string, std::string>* origins,
                   std::map<std::string, ItemState>* known);
  void report(const char* what, size_t done, size_t total, int64_t bytes = 0);
  // Changelogs that did not open (an encrypted account's, changed on the
  // share): never applied, named in this run's outcome.
  void setAsideChangeLogs(const std::map<int64_t, RefusedChangeLog>& refused);

  NubiloRemoteSession& session_;
  engine::SyncEngine& engine_;
  Collection collection_;
  VdirCollection folder_;
  SyncOptions options_;
  ConflictStore& conflicts_;
  HeldLocks& locks_;
  std::string folderClient_;
  DataclassOutcome outcome_;
  std::vector<SetAsideItem> refusedLogs_;
  bool locked_ = false;
};

}  // namespace vtc::client
