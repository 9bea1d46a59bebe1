// The engine's database: schema and migrations, client records, schema
// versions and sync plans.
#include "platform/engine/SqliteEngine.h"

#include <sys/stat.h>

#include "common/Clock.h"
#include "common/Logging.h"
#include "platform/fs/LocalPaths.h"
#include "platform/plist/PlistCodec.h"

namespace vtc::engine {

namespace {

constexpr int kSchemaVersion = 4;
constexpr const char* kEngineVersion = "1.0";

// Each step moves the database from version (index) to (index + 1).
const char* const kMigrations[] = {
    R"(CREATE TABLE records (dataclass TEXT NOT NULL, id TEXT NOT NULL, entity TEXT,
                             properties BLOB NOT NULL, PRIMARY KEY (dataclass, id));
       CREATE TABLE journal (seq INTEGER PRIMARY KEY AUTOINCREMENT, dataclass TEXT NOT NULL,
                             record TEXT NOT NULL, client TEXT NOT NULL, type INTEGER NOT NULL,
                             changes BLOB NOT NULL, pushed REAL NOT NULL);
       CREATE INDEX journal_by_dataclass ON journal (dataclass, seq);
       CREATE INDEX journal_by_record ON journal (dataclass, record, seq);
       CREATE TABLE clients (id TEXT PRIMARY KEY, description BLOB, settings BLOB);
       CREATE TABLE anchors (client TEXT NOT NULL, dataclass TEXT NOT NULL,
                             seq INTEGER NOT NULL DEFAULT 0, needs_truth INTEGER NOT NULL DEFAULT 0,
                             PRIMARY KEY (client, dataclass));
       CREATE TABLE schemas (dataclass TEXT PRIMARY KEY, versions BLOB NOT NULL);
       CREATE TABLE plans (id INTEGER PRIMARY KEY AUTOINCREMENT, status INTEGER NOT NULL,
                           participants BLOB NOT NULL, began REAL NOT NULL, ended REAL);)",
    R"(ALTER TABLE journal ADD COLUMN origin TEXT NOT NULL DEFAULT '';
       CREATE TABLE client_states (client TEXT NOT NULL, dataclass TEXT NOT NULL,
                                   state BLOB NOT NULL, PRIMARY KEY (client, dataclass));
       CREATE TABLE item_states (client TEXT NOT NULL, dataclass TEXT NOT NULL,
                                 item TEXT NOT NULL, size INTEGER NOT NULL,
                                 modified INTEGER NOT NULL, changed INTEGER NOT NULL,
                                 inode INTEGER NOT NULL, detail BLOB NOT NULL,
                                 PRIMARY KEY (client, dataclass, item));)",
    R"(CREATE TABLE tombstones (dataclass TEXT NOT NULL, id TEXT NOT NULL,
                              properties BLOB NOT NULL, deleted REAL NOT NULL,
                              PRIMARY KEY (dataclass, id));)",
    // Items are known by their identity, not their file name: what earlier
    // versions kept is read again from the folders and the share.
    R"(DELETE FROM item_states; DELETE FROM client_states; DELETE FROM records;
       DELETE FROM tombstones; DELETE FROM journal; DELETE FROM anchors;
       ALTER TABLE item_states ADD COLUMN record TEXT NOT NULL DEFAULT '';
       ALTER TABLE tombstones ADD COLUMN origin TEXT NOT NULL DEFAULT '';
       ALTER TABLE tombstones ADD COLUMN here INTEGER NOT NULL DEFAULT 0;
       CREATE TABLE folder_takes (client TEXT NOT NULL, dataclass TEXT NOT NULL,
                                  record TEXT NOT NULL, PRIMARY KEY (client, dataclass, record));
       CREATE TABLE set_aside (dataclass TEXT NOT NULL, record TEXT NOT NULL, file TEXT NOT NULL,
                               reason TEXT NOT NULL, origin TEXT NOT NULL, date REAL NOT NULL,
                               PRIMARY KEY (dataclass, record));
       CREATE INDEX item_states_by_record ON item_states (dataclass, record);)",
};

double seconds(Date d) {
  return std::chrono::duration<double>(d.time_since_epoch()).count();
}

}  // namespace

Bytes encode(const Value& value) {
  return plist::toBinary(value);
}

Value decode(const Bytes& bytes) {
  return plist::parse(bytes).value_or(Value());
}

std::string SyncEngine::bundleVersion() {
  return kEngineVersion;
}

std::unique_ptr<SyncEngine> SyncEngine::open() {
  std::string folder = paths::supportFolder().value_or(
      paths::join(paths::applicationSupportDirectory(), "NubiloSyncClient"));
  paths::makeDirectories(folder, 0700);
  return open(paths::join(folder, "SyncEngine.sqlite"));
}

std::unique_ptr<SyncEngine> SyncEngine::open(const std::string& path) {
  return std::make_unique<SqliteEngine>(path);
}

std::unique_ptr<SyncEngine> SyncEngine::openInMemoryCopy() {
  std::string folder = paths::supportFolder().value_or(
      paths::join(paths::applicationSupportDirectory(), "NubiloSyncClient"));
  paths::makeDirectories(folder, 0700);
  return std::make_unique<SqliteEngine>(paths::join(folder, "SyncEngine.sqlite"), true);
}

SqliteEngine::SqliteEngine(const std::string& path) : SqliteEngine(path, false) {}

SqliteEngine::SqliteEngine(const std::string& path, bool inMemoryCopy)
    : path_(path), db_(inMemoryCopy ? ":memory:" : path) {
  try {
    if (inMemoryCopy)
      db_.copyFrom(path);
    else
      // FULL: a transaction that returned is on disk, so that a power cut
      // never takes back a record of files written or changes sent.
      db_.exec("PRAGMA journal_mode=WAL; PRAGMA synchronous=FULL; PRAGMA foreign_keys=ON;");
    migrate();
  } catch (const EngineError& e) {
    // A damaged file is reported and left where it is for inspection.
    VTC_LOG_ERROR("Sync engine database %@ cannot be used: %@", path, e.what());
    throw EngineError("the sync engine database " + path +
                      " is damaged or not a database; it was left in place: " + e.what());
  }
}

void SqliteEngine::migrate() {
  Transaction t(db_);
  Statement version(db_.handle(), "PRAGMA user_version");
  version.step();
  int current = static_cast<int>(version.integer(0));
  version.reset();
  if (current > kSchemaVersion)
    throw EngineError("database version " + std::to_string(current) +
                      " is newer than this "
                      "engine");
  for (int v = current; v < kSchemaVersion; ++v) db_.exec(kMigrations[v]);
  db_.exec(("PRAGMA user_version=" + std::to_string(kSchemaVersion)).c_str());
  t.commit();
}

std::string SqliteEngine::version() {
  return bundleVersion();
}

void SqliteEngine::registerClient(const std::string& client, const Dictionary& description) {
  Statement s(db_.handle(),
              "INSERT INTO clients (id, description, settings) VALUES (?1, ?2, ?3) "
              "ON CONFLICT(id) DO UPDATE SET description = excluded.description");
  s.bind(1, client).bind(2, encode(Value(description))).bind(3, encode(Value(Dictionary{}))).run();
}

bool SqliteEngine::hasClient(const std::string& client) {
  Statement s(db_.handle(), "SELECT 1 FROM clients WHERE id = ?1");
  s.bind(1, client);
  return s.step();
}

Dictionary SqliteEngine::clientSettings(const std::string& client) {
  Statement s(db_.handle(), "SELECT settings FROM clients WHERE id = ?1");
  s.bind(1, client);
  if (!s.step()) throw EngineError("no client record for " + client);
  return decode(s.blob(0)).dictionary();
}

void SqliteEngine::storeClientSettings(const std::string& client, const Dictionary& settings) {
  Statement s(db_.handle(), "UPDATE clients SET settings = ?2 WHERE id = ?1");
  s.bind(1, client).bind(2, encode(Value(settings))).run();
}

Value SqliteEngine::objectForKey(const std::string& client, const std::string& key) {
  return clientSettings(client).get(key);
}

void SqliteEngine::setObjectForKey(const std::string& client, const std::string& key,
                                   const Value& value) {
  Transaction t(db_);
  Dictionary settings = clientSettings(client);
  if (value.isNone())
    settings.erase(key);
  else
    settings.set(key, value);
  storeClientSettings(client, settings);
  t.commit();
}

void SqliteEngine::setSyncsAfterClients(const std::string& client, bool after) {
  setObjectForKey(client, "SyncsAfterClients", Value(after));
}

void SqliteEngine::setShouldSynchronize(const std::string& client, bool should,
                                        const std::vector<std::string>& clientTypes) {
  Transaction t(db_);
  Dictionary settings = clientSettings(client);
  Dictionary types = settings.get("SynchronizeWithClientTypes").dictionary();
  for (const std::string& type : clientTypes) types.set(type, Value(should));
  settings.set("SynchronizeWithClientTypes", Value(types));
  storeClientSettings(client, settings);
  t.commit();
}

void SqliteEngine::setSchemaVersions(const std::string& dataclass, const Array& versions) {
  Statement s(db_.handle(),
              "INSERT INTO schemas (dataclass, versions) VALUES (?1, ?2) "
              "ON CONFLICT(dataclass) DO UPDATE SET versions = excluded.versions");
  s.bind(1, dataclass).bind(2, encode(Value(versions))).run();
}

Array SqliteEngine::schemaVersions(const std::string& dataclass) {
  Statement s(db_.handle(), "SELECT versions FROM schemas WHERE dataclass = ?1");
  s.bind(1, dataclass);
  return s.step() ? decode(s.blob(0)).array() : Array{};
}

int64_t SqliteEngine::beginSyncPlan(const std::vector<std::string>& participants) {
  Array list;
  for (const auto& p : participants) list.push_back(Value(p));
  Statement s(db_.handle(), "INSERT INTO plans (status, participants, began) VALUES (1, ?1, ?2)");
  s.bind(1, encode(Value(list))).bind(2, seconds(currentClock().now())).run();
  return sqlite3_last_insert_rowid(db_.handle());
}

void SqliteEngine::setSyncPlanStatus(int64_t plan, int32_t status) {
  Statement s(db_.handle(), "UPDATE plans SET status = ?2 WHERE id = ?1");
  s.bind(1, plan).bind(2, int64_t{status}).run();
}

void SqliteEngine::endSyncPlan(int64_t plan) {
  Statement s(db_.handle(), "UPDATE plans SET status = 0, ended = ?2 WHERE id = ?1");
  s.bind(1, plan).bind(2, seconds(currentClock().now())).run();
}

std::vector<SyncPlan> SqliteEngine::currentSyncPlans() {
  Statement s(db_.handle(), "SELECT id, status, participants FROM plans WHERE ended IS NULL");
  std::vector<SyncPlan> plans;
  while (s.step()) {
    SyncPlan p{s.integer(0), static_cast<int32_t>(s.integer(1)), {}};
    const Value participants = decode(s.blob(2));
    for (const Value& v : participants.array()) p.participants.push_back(v.string());
    plans.push_back(std::move(p));
  }
  return plans;
}

int64_t SqliteEngine::anchorOf(const std::string& client, const std::string& dataclass,
                               bool* needsTruth) {
  Statement s(db_.handle(),
              "SELECT seq, needs_truth FROM anchors WHERE client = ?1 AND dataclass = ?2");
  s.bind(1, client).bind(2, dataclass);
  if (!s.step()) {
    if (needsTruth) *needsTruth = false;
    return 0;
  }
  if (needsTruth) *needsTruth = s.integer(1) != 0;
  return s.integer(0);
}

void SqliteEngine::acknowledge(const std::string& client, const std::string& dataclass,
                               int64_t anchor, const StateUpdate& state) {
  Transaction t(db_);
  Statement s(db_.handle(),
              "INSERT INTO anchors (client, dataclass, seq, needs_truth) VALUES (?1, ?2, ?3, 0) "
              "ON CONFLICT(client, dataclass) DO UPDATE SET seq = MAX(seq, excluded.seq), "
              "needs_truth = 0");
  s.bind(1, client).bind(2, dataclass).bind(3, anchor).run();
  writeState(client, dataclass, state);
  t.commit();
}

std::vector<SyncEngineChange> SqliteEngine::records(const std::string& dataclass) {
  Statement all(db_.handle(), "SELECT id, properties FROM records WHERE dataclass = ?1");
  all.bind(1, dataclass);
  std::vector<SyncEngineChange> truth;
  while (all.step()) {
    Array sets;
    const Value properties = decode(all.blob(1));
    for (const auto& [name, value] : properties.dictionary())
      sets.push_back(Value(Dictionary{{"action", "set"}, {"name", name}, {"value", value}}));
    truth.emplace_back(SyncEngineChange::kAdd, all.text(0), std::move(sets));
  }
  return truth;
}

int64_t SqliteEngine::recordCount(const std::string& dataclass) {
  Statement count(db_.handle(), "SELECT COUNT(*) FROM records WHERE dataclass = ?1");
  count.bind(1, dataclass);
  count.step();
  return count.integer(0);
}

Value SqliteEngine::clientState(const std::string& client, const std::string& dataclass) {
  Statement s(db_.handle(), "SELECT state FROM client_states WHERE client = ?1 AND dataclass = ?2");
  s.bind(1, client).bind(2, dataclass);
  return s.step() ? decode(s.blob(0)) : Value();
}

std::map<std::string, ItemStamp> SqliteEngine::itemStamps(const std::string& client,
                                                          const std::string& dataclass) {
  Statement s(db_.handle(),
              "SELECT item, size, modified, changed, inode, record FROM item_states WHERE "
              "client = ?1 AND dataclass = ?2");
  s.bind(1, client).bind(2, dataclass);
  std::map<std::string, ItemStamp> stamps;
  while (s.step())
    stamps.emplace_hint(stamps.end(), s.text(0),
                        ItemStamp{s.integer(1), s.integer(2), s.integer(3),
                                  static_cast<uint64_t>(s.integer(4)), s.text(5)});
  return stamps;
}

std::map<std::string, Value> SqliteEngine::itemDetails(const std::string& client,
                                                       const std::string& dataclass,
                                                       const std::vector<std::string>& items) {
  // An empty detail is the record's truth.
  Statement s(db_.handle(),
              "SELECT CASE WHEN length(s.detail) > 0 THEN s.detail ELSE r.properties END "
              "FROM item_states s LEFT JOIN records r ON r.dataclass = s.dataclass AND "
              "r.id = s.record WHERE s.client = ?1 AND s.dataclass = ?2 AND s.item = ?3");
  std::map<std::string, Value> details;
  for (const std::string& item : items) {
    s.bind(1, client).bind(2, dataclass).bind(3, item);
    if (s.step() && !s.isNull(0)) details.emplace(item, decode(s.blob(0)));
    s.reset();
  }
  return details;
}

void SqliteEngine::saveState(const std::string& client, const std::string& dataclass,
                             const StateUpdate& state) {
  Transaction t(db_);
  writeState(client, dataclass, state);
  t.commit();
}

void SqliteEngine::writeState(const std::string& client, const std::string& dataclass,
                              const StateUpdate& state) {
  if (state.clientState) {
    Statement s(db_.handle(),
                "INSERT INTO client_states (client, dataclass, state) VALUES (?1, ?2, ?3) "
                "ON CONFLICT(client, dataclass) DO UPDATE SET state = excluded.state");
    s.bind(1, client).bind(2, dataclass).bind(3, encode(*state.clientState)).run();
  }
  if (state.items.empty()) return;
  Statement put(db_.handle(),
                "INSERT OR REPLACE INTO item_states (client, dataclass, item, size, modified, "
                "changed, inode, detail, record) VALUES (?1, ?2, ?3, ?4, ?5, ?6, ?7, ?8, ?9)");
  Statement drop(db_.handle(),
                 "DELETE FROM item_states WHERE client = ?1 AND dataclass = ?2 AND item = ?3");
  for (const auto& [item, stored] : state.items) {
    if (stored) {
      put.bind(1, client).bind(2, dataclass).bind(3, item).bind(4, stored->stamp.size);
      put.bind(5, stored->stamp.modified).bind(6, stored->stamp.changed);
      put.bind(7, static_cast<int64_t>(stored->stamp.inode));
      put.bind(8, stored->detail.isNone() ? Bytes{} : encode(stored->detail));
      put.bind(9, stored->stamp.record).run();
    } else {
      drop.bind(1, client).bind(2, dataclass).bind(3, item).run();
    }
  }
}

void SqliteEngine::resetClient(const std::string& client, const std::string& dataclass) {
  Statement s(db_.handle(),
              "INSERT INTO anchors (client, dataclass, seq, needs_truth) VALUES (?1, ?2, 0, 1) "
              "ON CONFLICT(client, dataclass) DO UPDATE SET needs_truth = 1");
  s.bind(1, client).bind(2, dataclass).run();
}

}  // namespace vtc::engine
