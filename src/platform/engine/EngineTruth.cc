// The sync client's side of the engine: the truth of each record as this
// computer last synced it, the records a folder still has to take in, and
// the records set aside. A sync stores what it decided in one transaction
// (storeSync) and a folder what it wrote in another (storeFolderUpdate).
#include "common/Clock.h"
#include "platform/engine/SqliteEngine.h"

namespace vtc::engine {

namespace {

double secondsOf(Date d) {
  return std::chrono::duration<double>(d.time_since_epoch()).count();
}

Date dateOf(double seconds) {
  return Date(std::chrono::duration_cast<Date::duration>(std::chrono::duration<double>(seconds)));
}

// Deleted records are kept this long, so that an edit made elsewhere before
// the delete was seen brings the whole record back.
constexpr double kTombstoneSeconds = 90 * 86400.0;

}  // namespace

std::map<std::string, Dictionary> SqliteEngine::recordsWithIdentifiers(
    const std::string& dataclass, const std::vector<std::string>& ids) {
  Statement s(db_.handle(), "SELECT properties FROM records WHERE dataclass = ?1 AND id = ?2");
  std::map<std::string, Dictionary> records;
  for (const std::string& id : ids) {
    s.bind(1, dataclass).bind(2, id);
    if (s.step()) records.emplace(id, decode(s.blob(0)).dictionary());
    s.reset();
  }
  return records;
}

std::map<std::string, Tombstone> SqliteEngine::tombstones(const std::string& dataclass,
                                                          const std::vector<std::string>& ids) {
  Statement s(db_.handle(),
              "SELECT properties, origin, here FROM tombstones WHERE dataclass = ?1 AND id = ?2");
  std::map<std::string, Tombstone> found;
  for (const std::string& id : ids) {
    s.bind(1, dataclass).bind(2, id);
    if (s.step())
      found.emplace(id, Tombstone{decode(s.blob(0)).dictionary(), s.text(1), s.integer(2) != 0});
    s.reset();
  }
  return found;
}

void SqliteEngine::forEachRecord(
    const std::string& dataclass,
    const std::function<void(const std::string& id, const Dictionary& record)>& visit) {
  Statement s(db_.handle(), "SELECT id, properties FROM records WHERE dataclass = ?1");
  s.bind(1, dataclass);
  while (s.step()) visit(s.text(0), decode(s.blob(1)).dictionary());
}

void SqliteEngine::storeSync(const std::string& dataclass, const SyncOutcome& outcome) {
  const double now = secondsOf(currentClock().now());
  Transaction t(db_);
  Statement read(db_.handle(), "SELECT properties FROM records WHERE dataclass = ?1 AND id = ?2");
  Statement write(db_.handle(),
                  "INSERT INTO records (dataclass, id, properties) VALUES (?1, ?2, ?3) "
                  "ON CONFLICT(dataclass, id) DO UPDATE SET properties = excluded.properties");
  Statement remove(db_.handle(), "DELETE FROM records WHERE dataclass = ?1 AND id = ?2");
  Statement bury(db_.handle(),
                 "INSERT OR REPLACE INTO tombstones (dataclass, id, properties, deleted, origin, "
                 "here) VALUES (?1, ?2, ?3, ?4, ?5, ?6)");
  Statement forget(db_.handle(), "DELETE FROM tombstones WHERE dataclass = ?1 AND id = ?2");
  // Items that hold a record's truth keep it, as their own, before it changes.
  Statement keepAside(db_.handle(),
                      "UPDATE item_states SET detail = COALESCE((SELECT properties FROM records "
                      "r WHERE r.dataclass = ?1 AND r.id = ?2), detail) WHERE dataclass = ?1 AND "
                      "record = ?2 AND length(detail) = 0");
  for (const SyncOutcome::Entry& entry : outcome.truth) {
    keepAside.bind(1, dataclass).bind(2, entry.id).run();
    if (entry.record) {
      write.bind(1, dataclass).bind(2, entry.id).bind(3, encode(Value(*entry.record))).run();
      forget.bind(1, dataclass).bind(2, entry.id).run();
      continue;
    }
    read.bind(1, dataclass).bind(2, entry.id);
    const bool existed = read.step();
    Bytes properties = existed ? read.blob(0) : Bytes{};
    read.reset();
    if (!existed) continue;
    remove.bind(1, dataclass).bind(2, entry.id).run();
    bury.bind(1, dataclass).bind(2, entry.id).bind(3, properties).bind(4, now);
    bury.bind(5, entry.origin).bind(6, int64_t{entry.here}).run();
  }
  Statement take(
      db_.handle(),
      "INSERT OR IGNORE INTO folder_takes (client, dataclass, record) VALUES (?1, ?2, ?3)");
  for (const std::string& id : outcome.folderTakes)
    take.bind(1, outcome.folderClient).bind(2, dataclass).bind(3, id).run();
  writeSetAside(dataclass, outcome.setAside);
  Statement purge(db_.handle(), "DELETE FROM tombstones WHERE deleted < ?1");
  purge.bind(1, now - kTombstoneSeconds).run();
  writeState(outcome.networkClient, dataclass, outcome.network);
  writeState(outcome.folderClient, dataclass, outcome.folder);
  t.commit();
}

std::vector<std::string> SqliteEngine::folderTakes(const std::string& client,
                                                   const std::string& dataclass) {
  Statement s(
      db_.handle(),
      "SELECT record FROM folder_takes WHERE client = ?1 AND dataclass = ?2 ORDER BY record");
  s.bind(1, client).bind(2, dataclass);
  std::vector<std::string> ids;
  while (s.step()) ids.push_back(s.text(0));
  return ids;
}

void SqliteEngine::storeFolderUpdate(const std::string& client, const std::string& dataclass,
                                     const FolderUpdate& update) {
  Transaction t(db_);
  Statement taken(db_.handle(),
                  "DELETE FROM folder_takes WHERE client = ?1 AND dataclass = ?2 AND record = ?3");
  for (const std::string& id : update.taken)
    taken.bind(1, client).bind(2, dataclass).bind(3, id).run();
  writeSetAside(dataclass, update.setAside);
  writeState(client, dataclass, update.state);
  t.commit();
}

void SqliteEngine::writeSetAside(
    const std::string& dataclass,
    const std::vector<std::pair<std::string, std::optional<SetAside>>>& entries) {
  if (entries.empty()) return;
  Statement aside(db_.handle(),
                  "INSERT OR REPLACE INTO set_aside (dataclass, record, file, reason, origin, "
                  "date) VALUES (?1, ?2, ?3, ?4, ?5, ?6)");
  Statement back(db_.handle(), "DELETE FROM set_aside WHERE dataclass = ?1 AND record = ?2");
  for (const auto& [id, record] : entries) {
    if (record) {
      aside.bind(1, dataclass).bind(2, id).bind(3, record->file).bind(4, record->reason);
      aside.bind(5, record->origin).bind(6, secondsOf(record->date)).run();
    } else {
      back.bind(1, dataclass).bind(2, id).run();
    }
  }
}

std::map<std::string, SetAside> SqliteEngine::setAsideRecords(const std::string& dataclass) {
  Statement s(db_.handle(),
              "SELECT record, file, reason, origin, date FROM set_aside WHERE dataclass = ?1");
  s.bind(1, dataclass);
  std::map<std::string, SetAside> records;
  while (s.step())
    records.emplace(s.text(0), SetAside{s.text(1), s.text(2), s.text(3), dateOf(s.real(4))});
  return records;
}

}  // namespace vtc::engine
