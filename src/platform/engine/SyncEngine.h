// The sync engine: the local truth store of this computer. Local programs
// push their edits into it and the network client pulls them out as
// SyncEngineChange lists, then pushes back what other computers committed.
// One SQLite database in the support folder, shared by every process of the
// user (WAL, busy timeout). Failures raise vtc::engine::EngineError; invalid
// changes std::invalid_argument. An object is used from one thread.
#pragma once

#include <cstdint>
#include <memory>
#include <stdexcept>
#include <string>
#include <vector>

#include "VantorSyncManager/SyncEngineChange.h"
#include "VantorSyncManager/Value.h"

namespace vtc::engine {

class EngineError : public std::runtime_error {
 public:
  using std::runtime_error::runtime_error;
};

struct PullResult {
  std::vector<SyncEngineChange> changes;  // one per record, coalesced
  int64_t anchor = 0;                     // acknowledge this once the changes are applied
};

struct SyncPlan {
  int64_t id = 0;
  int32_t status = 0;  // 1 and 7 mean running
  std::vector<std::string> participants;
};

class SyncEngine {
 public:
  // The engine of this user (support folder), or of the database at path.
  static std::unique_ptr<SyncEngine> open();
  static std::unique_ptr<SyncEngine> open(const std::string& path);
  virtual ~SyncEngine() = default;

  // The version of this engine, the one source of the version that writers
  // of changes name ("CreatorEngineVersion"); known without opening a
  // database.
  static std::string bundleVersion();
  virtual std::string version() = 0;

  // Client records: registered with a description, with settings by key.
  virtual void registerClient(const std::string& client, const Dictionary& description) = 0;
  virtual Value objectForKey(const std::string& client, const std::string& key) = 0;
  virtual void setObjectForKey(const std::string& client, const std::string& key,
                               const Value& value) = 0;
  virtual void setSyncsAfterClients(const std::string& client, bool after) = 0;
  virtual void setShouldSynchronize(const std::string& client, bool should,
                                    const std::vector<std::string>& clientTypes) = 0;

  // Schema versions of a dataclass: dictionaries of "Name", "MajorVersion",
  // "MinorVersion".
  virtual void setSchemaVersions(const std::string& dataclass, const Array& versions) = 0;
  virtual Array schemaVersions(const std::string& dataclass) = 0;

  // Change exchange. A push is applied whole or not at all.
  virtual void push(const std::string& client, const std::string& dataclass,
                    const std::vector<SyncEngineChange>& changes) = 0;
  virtual PullResult pull(const std::string& client, const std::string& dataclass) = 0;
  virtual void acknowledge(const std::string& client, const std::string& dataclass,
                           int64_t anchor) = 0;
  // The client's next pull is the whole truth, as adds.
  virtual void resetClient(const std::string& client, const std::string& dataclass) = 0;

  // Sync plans, recorded while a sync runs so that other processes can see it.
  virtual int64_t beginSyncPlan(const std::vector<std::string>& participants) = 0;
  virtual void setSyncPlanStatus(int64_t plan, int32_t status) = 0;
  virtual void endSyncPlan(int64_t plan) = 0;
  virtual std::vector<SyncPlan> currentSyncPlans() = 0;
};

}  // namespace vtc::engine
