// What `status` says, gathered once and shown as text or as JSON: this
// computer's folders and how their syncs went, the share's view of each,
// every computer of the account with its last report, the kept conflicts,
// and whether a sync runs now.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "VantorSyncManager/Value.h"
#include "client/run/ConflictStore.h"
#include "client/run/SyncFailure.h"

namespace vtc::client {

struct DataclassStatus {
  std::string name;
  std::string kind;
  std::string folder;
  int64_t items = 0;  // files this computer's folder held at its last sync
  std::optional<Date> lastAttempt, lastSuccess;
  int64_t failedCount = 0;
  std::optional<std::string> lastError;
  // The share's view (when it could be asked).
  std::optional<int64_t> minversion, maxversion;
  std::optional<std::string> serverStatus;  // this computer's status there, "needstruth" say
  // Items the last sync left over: files skipped, records set aside, files
  // not written, each "name: why".
  std::vector<std::string> leftOver;
};

struct ComputerStatus {
  std::string name;
  std::string guid;
  bool thisComputer = false;
  std::optional<std::string> lastSync;  // as the computer wrote it
  Dictionary report;                    // its last sync report, when it left one
};

struct StatusReport {
  bool setUp = false;
  std::string computerName, computerGuid, member, server;
  std::optional<int> runningPid;  // a sync runs now, in this process
  bool scheduleOn = false;
  std::string cadence;  // "hourly at :05"
  std::optional<Date> nextScheduledSync;
  bool pushOn = false;
  std::string pushServer;
  std::string logFile;   // where the log is, "~/..."
  std::string logLevel;  // error, warn, info or debug
  std::vector<DataclassStatus> dataclasses;
  std::vector<ComputerStatus> computers;
  std::vector<KeptConflict> conflicts;
  // Why the share could not be asked, when it could not.
  std::optional<std::string> serverError;
  std::optional<FailureKind> serverErrorKind;
};

// Never raises for the share: a failure there is in serverError.
StatusReport gatherStatus();

// The per-host keys of a dataclass's last failure sentence, and of the
// files its last sync skipped or could not write.
std::string lastErrorKey(const std::string& dataclass);
std::string leftOverKey(const std::string& dataclass);

}  // namespace vtc::client
