// One run of the sync client: the owner lock, the session from the stored
// account, every requested dataclass in turn, then the preferences, the
// last-sync notification, statistics and the report of the run.
#pragma once

#include <string>
#include <vector>

#include "client/run/DataclassSync.h"
#include "client/run/SyncFailure.h"

namespace vtc::client {

struct RunRequest {
  std::vector<std::string> dataclasses;  // empty: every configured one
  bool dryRun = false;
  int maxDeletePercent = 50;
  bool deletesConfirmed = false;  // see SyncOptions::deletesConfirmed
  bool periodic = false;          // started by the schedule
  bool repair = false;            // see SyncOptions::repair
  Progress* progress = nullptr;
};

struct DataclassFailure {
  std::string dataclass;
  std::string sentence;
  FailureKind kind;
};

struct RunResult {
  std::vector<DataclassOutcome> outcomes;
  std::vector<DataclassFailure> failures;
  // Sentences the user is told whatever the outcome (a password that went
  // unencrypted over the network).
  std::vector<std::string> warnings;
  // 0, the exit status of the first failure, or 9 when every dataclass
  // synced but items were left over (skipped, set aside, not written).
  int exitStatus() const;
};

// Raises SyncFailure for what stops the whole run (no account, another run,
// a login refused, an unreachable server); a dataclass's own failure is
// recorded in the result and the next dataclass is synced.
RunResult runSync(const RunRequest& request);

// The sentence for a dataclass name that no folder here syncs: the names
// that are synced.
std::string notSyncedSentence(const std::string& name);

}  // namespace vtc::client
