// The sync engine: the local truth store of this computer. Local programs
// push their edits into it and the network client pulls them out as
// SyncEngineChange lists, then pushes back what other computers committed.
// One SQLite database in the support folder, shared by every process of the
// user (WAL, busy timeout). Failures raise vtc::engine::EngineError; invalid
// changes std::invalid_argument; memory SQLite cannot get std::bad_alloc.
// An object is used from one thread.
#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <stdexcept>
#include <string>
#include <utility>
#include <vector>

#include "VantorSyncManager/SyncEngineChange.h"
#include "VantorSyncManager/Value.h"

namespace vtc::engine {

class EngineError : public std::runtime_error {
 public:
  using std::runtime_error::runtime_error;
};

struct PullResult {
  // One per record, coalesced. A modify carries the current value of every
  // property that others changed (a clear where it is gone); an add carries
  // the whole record and replaces what the client had under its identifier.
  std::vector<SyncEngineChange> changes;
  int64_t anchor = 0;  // acknowledge this once the changes are applied
  // After a reset the changes are the whole truth: the client drops every
  // record they do not name.
  bool isTruth = false;
};

// One property edited by two clients between their pulls: the value kept
// and the value that lost (none for a clear), with who made each.
struct Conflict {
  std::string dataclass;
  std::string record;
  std::string property;
  Value kept;
  Value lost;
  std::string keptClient, lostClient;
  std::string keptOrigin, lostOrigin;  // the computers, where the pushes named them
  Date date;
};

// What a client knows of one of its items (a file): a stamp it compares
// cheaply on every sync, and details read only for the items that changed.
struct ItemStamp {
  int64_t size = 0;
  int64_t modified = 0;  // nanoseconds
  int64_t changed = 0;   // nanoseconds
  uint64_t inode = 0;
  std::string record;  // the record the item holds
  friend bool operator==(const ItemStamp&, const ItemStamp&) = default;
};
struct StoredItem {
  ItemStamp stamp;
  // None: the item holds its record's truth, which is not stored twice
  // (the engine keeps the truth it held aside before the truth changes).
  Value detail;
};

// What a client remembers beside its changes, saved in the same transaction
// as a push or an acknowledgement, so that a crash never separates them: a
// state of its own and one per item (none removes an item).
struct StateUpdate {
  std::optional<Value> clientState;
  std::vector<std::pair<std::string, std::optional<StoredItem>>> items;
  bool empty() const { return !clientState && items.empty(); }
};

struct PushOptions {
  std::string origin;  // the computer that made the changes, for conflict records
  // Told of every conflict, inside the push's transaction: a failure raised
  // here undoes the whole push.
  std::function<void(const Conflict&)> onConflict;
  StateUpdate state;
};

// A deleted record, kept so that an edit made elsewhere before the delete
// was seen brings it back whole.
struct Tombstone {
  Dictionary record;
  std::string origin;  // the computer that deleted it
  bool here = false;   // whether that was this computer
};

// A record that could not be written where it goes (it makes no valid
// item): kept in the truth, named to the user, tried again when it changes.
struct SetAside {
  std::string file;
  std::string reason;
  std::string origin;  // the computer that sent it last
  Date date;
};

// What one sync decided, stored in one transaction so that a crash never
// separates the truth from the states that say what was taken in.
struct SyncOutcome {
  struct Entry {
    std::string id;
    std::optional<Dictionary> record;  // none: deleted (and buried)
    std::string origin;                // who changed or deleted it
    bool here = false;                 // whether that was this computer
  };
  std::vector<Entry> truth;
  // Records whose files the folder client must write or remove.
  std::vector<std::string> folderTakes;
  // Records set aside (none: no longer), such as one whose change could
  // not be read.
  std::vector<std::pair<std::string, std::optional<SetAside>>> setAside;
  std::string networkClient, folderClient;
  StateUpdate network;  // the network client's state
  StateUpdate folder;   // the folder client's item states
};

// What the folder client wrote, stored in one transaction.
struct FolderUpdate {
  std::vector<std::string> taken;  // records now written where they go
  StateUpdate state;
  std::vector<std::pair<std::string, std::optional<SetAside>>> setAside;  // none: no longer
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
  // An engine on a copy of this user's database held in memory: everything
  // done to it is forgotten when it closes (a dry run).
  static std::unique_ptr<SyncEngine> openInMemoryCopy();
  virtual ~SyncEngine() = default;

  // The version of this engine, the one source of the version that writers
  // of changes name ("CreatorEngineVersion"); known without opening a
  // database.
  static std::string bundleVersion();
  virtual std::string version() = 0;

  // Client records: registered with a description, with settings by key.
  virtual void registerClient(const std::string& client, const Dictionary& description) = 0;
  // Whether the client has been registered.
  virtual bool hasClient(const std::string& client) = 0;
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
  void push(const std::string& client, const std::string& dataclass,
            const std::vector<SyncEngineChange>& changes) {
    push(client, dataclass, changes, PushOptions{});
  }
  virtual void push(const std::string& client, const std::string& dataclass,
                    const std::vector<SyncEngineChange>& changes, const PushOptions& options) = 0;
  virtual PullResult pull(const std::string& client, const std::string& dataclass) = 0;
  void acknowledge(const std::string& client, const std::string& dataclass, int64_t anchor) {
    acknowledge(client, dataclass, anchor, StateUpdate{});
  }
  virtual void acknowledge(const std::string& client, const std::string& dataclass, int64_t anchor,
                           const StateUpdate& state) = 0;

  // The whole truth of a dataclass, as adds, and how many records it has.
  virtual std::vector<SyncEngineChange> records(const std::string& dataclass) = 0;
  virtual int64_t recordCount(const std::string& dataclass) = 0;

  // A client's remembered states (see StateUpdate).
  virtual Value clientState(const std::string& client, const std::string& dataclass) = 0;
  virtual std::map<std::string, ItemStamp> itemStamps(const std::string& client,
                                                      const std::string& dataclass) = 0;
  // The details of these items (those without are left out).
  virtual std::map<std::string, Value> itemDetails(const std::string& client,
                                                   const std::string& dataclass,
                                                   const std::vector<std::string>& items) = 0;
  virtual void saveState(const std::string& client, const std::string& dataclass,
                         const StateUpdate& state) = 0;
  // The client's next pull is the whole truth, as adds.
  virtual void resetClient(const std::string& client, const std::string& dataclass) = 0;

  // The sync client's truth: records, tombstones, what a folder still has
  // to take in, and records set aside.
  virtual std::map<std::string, Dictionary> recordsWithIdentifiers(
      const std::string& dataclass, const std::vector<std::string>& ids) = 0;
  virtual std::map<std::string, Tombstone> tombstones(const std::string& dataclass,
                                                      const std::vector<std::string>& ids) = 0;
  // Every record of the truth, one at a time, without holding them all.
  virtual void forEachRecord(
      const std::string& dataclass,
      const std::function<void(const std::string& id, const Dictionary& record)>& visit) = 0;
  virtual void storeSync(const std::string& dataclass, const SyncOutcome& outcome) = 0;
  virtual std::vector<std::string> folderTakes(const std::string& client,
                                               const std::string& dataclass) = 0;
  virtual void storeFolderUpdate(const std::string& client, const std::string& dataclass,
                                 const FolderUpdate& update) = 0;
  virtual std::map<std::string, SetAside> setAsideRecords(const std::string& dataclass) = 0;

  // Sync plans, recorded while a sync runs so that other processes can see it.
  virtual int64_t beginSyncPlan(const std::vector<std::string>& participants) = 0;
  virtual void setSyncPlanStatus(int64_t plan, int32_t status) = 0;
  virtual void endSyncPlan(int64_t plan) = 0;
  virtual std::vector<SyncPlan> currentSyncPlans() = 0;
};

}  // namespace vtc::engine
