// The sync engine on SQLite.
#pragma once

#include <string>

#include "platform/engine/Sqlite.h"
#include "platform/engine/SyncEngine.h"

namespace vtc::engine {

class SqliteEngine final : public SyncEngine {
 public:
  explicit SqliteEngine(const std::string& path);
  // A database in memory holding a copy of the one at path.
  SqliteEngine(const std::string& path, bool inMemoryCopy);

  using SyncEngine::acknowledge;
  using SyncEngine::push;

  std::string version() override;
  void registerClient(const std::string& client, const Dictionary& description) override;
  bool hasClient(const std::string& client) override;
  Value objectForKey(const std::string& client, const std::string& key) override;
  void setObjectForKey(const std::string& client, const std::string& key,
                       const Value& value) override;
  void setSyncsAfterClients(const std::string& client, bool after) override;
  void setShouldSynchronize(const std::string& client, bool should,
                            const std::vector<std::string>& clientTypes) override;
  void setSchemaVersions(const std::string& dataclass, const Array& versions) override;
  Array schemaVersions(const std::string& dataclass) override;
  void push(const std::string& client, const std::string& dataclass,
            const std::vector<SyncEngineChange>& changes, const PushOptions& options) override;
  PullResult pull(const std::string& client, const std::string& dataclass) override;
  void acknowledge(const std::string& client, const std::string& dataclass, int64_t anchor,
                   const StateUpdate& state) override;
  std::vector<SyncEngineChange> records(const std::string& dataclass) override;
  int64_t recordCount(const std::string& dataclass) override;
  Value clientState(const std::string& client, const std::string& dataclass) override;
  std::map<std::string, ItemStamp> itemStamps(const std::string& client,
                                              const std::string& dataclass) override;
  std::map<std::string, Value> itemDetails(const std::string& client, const std::string& dataclass,
                                           const std::vector<std::string>& items) override;
  void saveState(const std::string& client, const std::string& dataclass,
                 const StateUpdate& state) override;
  void resetClient(const std::string& client, const std::string& dataclass) override;
  std::map<std::string, Dictionary> recordsWithIdentifiers(
      const std::string& dataclass, const std::vector<std::string>& ids) override;
  std::map<std::string, Tombstone> tombstones(const std::string& dataclass,
                                              const std::vector<std::string>& ids) override;
  void forEachRecord(
      const std::string& dataclass,
      const std::function<void(const std::string& id, const Dictionary& record)>& visit) override;
  void storeSync(const std::string& dataclass, const SyncOutcome& outcome) override;
  std::vector<std::string> folderTakes(const std::string& client,
                                       const std::string& dataclass) override;
  void storeFolderUpdate(const std::string& client, const std::string& dataclass,
                         const FolderUpdate& update) override;
  std::map<std::string, SetAside> setAsideRecords(const std::string& dataclass) override;
  int64_t beginSyncPlan(const std::vector<std::string>& participants) override;
  void setSyncPlanStatus(int64_t plan, int32_t status) override;
  void endSyncPlan(int64_t plan) override;
  std::vector<SyncPlan> currentSyncPlans() override;

 private:
  void migrate();
  void writeState(const std::string& client, const std::string& dataclass,
                  const StateUpdate& state);
  void writeSetAside(const std::string& dataclass,
                     const std::vector<std::pair<std::string, std::optional<SetAside>>>& entries);
  Dictionary clientSettings(const std::string& client);
  void storeClientSettings(const std::string& client, const Dictionary& settings);
  int64_t anchorOf(const std::string& client, const std::string& dataclass, bool* needsTruth);

  std::string path_;
  Database db_;
};

// Property values are kept as binary property lists.
Bytes encode(const Value& value);
Value decode(const Bytes& bytes);

}  // namespace vtc::engine
