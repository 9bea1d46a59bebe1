// The sync of one dataclass between its vdir folder, this computer's
// engine and the share: the folder's edits go into the engine; the
// changelogs other computers committed come in (from where this computer
// left off, or from minversion as a slow sync after a reset, for a new
// computer or a damaged record, keeping every local edit not yet sent);
// what this computer changed goes out as one new changelog; the engine's
// changes for the folder go back into files. The delete guard runs before
// anything is written anywhere; a dry run writes nothing at all.
#pragma once

#include <cstdint>
#include <functional>
#include <optional>
#include <string>

#include "VantorSyncManager/NubiloRemoteSession.h"
#include "client/run/Collections.h"
#include "client/run/ConflictStore.h"
#include "client/run/HeldLocks.h"
#include "client/run/Progress.h"
#include "client/run/ServerView.h"
#include "client/stores/VdirCollection.h"
#include "platform/engine/SyncEngine.h"

namespace vtc::client {

struct SyncOptions {
  bool dryRun = false;
  int maxDeletePercent = 50;
  std::string computerName;  // this computer, named in conflicts
  // Write this computer's whole truth as a reset commit (a damaged history
  // is then never read again); only a computer that took in every
  // changelog may.
  bool repair = false;
  Progress* progress = nullptr;  // told how far the sync has come, when set
};

struct DataclassOutcome {
  std::string dataclass;
  std::string mode = "none";   // "none", "fast" or "slow"
  size_t sentChanges = 0;      // committed (or, in a dry run, that would be)
  size_t receivedChanges = 0;  // in changelogs of other computers
  size_t filesWritten = 0;     // written or removed (or that would be)
  size_t filesSkipped = 0;     // changed on disk meanwhile: left for the next sync
  size_t invalidFiles = 0;
  size_t conflicts = 0;
  int64_t changelogsFetched = 0;
  int64_t bytesFetched = 0;
  bool usedServer = false;  // locked, fetched or committed
  bool compacted = false;
  std::optional<int64_t> committedIndex;
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
  struct Remote;  // what the server side of one run found and decided

  std::vector<SyncEngineChange> folderChanges(const ScanResult& scan,
                                              const std::map<std::string, Dictionary>& lastFields);
  void checkLocalDeletes(const ScanResult& scan, size_t known);
  // Locks this client and the dataclass (registering them where the share
  // lacks them); listed: whether the share's listing showed the dataclass.
  void lock(bool listed);
  void lockReleasingOwnLeftovers(const std::function<void()>& lockOperation);
  void unlock();
  Remote fetch(bool slow, const DataclassRecord& record);
  // lastFields: the fields of the files edited here as this computer last
  // saw them, to tell the share's concurrent edits of the same fields.
  void applyRemote(Remote& remote, const engine::PullResult& pending,
                   const std::map<std::string, Dictionary>& lastFields);
  void noteConflict(const engine::Conflict& conflict);
  void commit(Remote& remote);
  void compactIfLong(Remote& remote);
  // Sets the record right when it names a changelog below index.
  void repairLaggingRecord(int64_t index);
  // After a reset commit: every other computer takes the truth in once.
  void markOthersNeedingTruth();
  void writeFolder();
  engine::PushOptions pushOptions(const std::string& origin, engine::StateUpdate state = {});
  void report(const char* what, size_t done, size_t total, int64_t bytes = 0);

  NubiloRemoteSession& session_;
  engine::SyncEngine& engine_;
  Collection collection_;
  VdirCollection folder_;
  SyncOptions options_;
  ConflictStore& conflicts_;
  HeldLocks& locks_;
  std::string folderClient_;
  DataclassOutcome outcome_;
  bool locked_ = false;
};

}  // namespace vtc::client
