// Pushing changes into the engine: applied to the records and journalled,
// all in one transaction. Edits of one property by two clients between two
// pulls are settled by push time (the later wins), then by client
// identifier (the greater wins).
#include <map>
#include <stdexcept>

#include "common/Clock.h"
#include "common/Logging.h"
#include "platform/engine/SqliteEngine.h"

namespace vtc::engine {

namespace {

double nowSeconds() {
  return std::chrono::duration<double>(currentClock().now().time_since_epoch()).count();
}

// Deleted records are kept this long, so that an edit made elsewhere before
// the delete was seen brings the whole record back, not the edited fields.
constexpr double kTombstoneSeconds = 90 * 86400.0;

struct Competing {
  Value value;  // none for a clear
  std::string client;
  std::string origin;
  double pushed;
};

}  // namespace

void SqliteEngine::push(const std::string& client, const std::string& dataclass,
                        const std::vector<SyncEngineChange>& changes, const PushOptions& options) {
  // Checked first: nothing of a push with an invalid value is applied.
  for (const SyncEngineChange& change : changes) {
    for (const Value& pc : change.changes()) {
      const Dictionary& d = pc.dictionary();
      const std::string& action = d.get("action").string();
      if ((action != "set" && action != "clear") || d.get("name").string().empty() ||
          (action == "set" && d.get("value").isNone()))
        throw std::invalid_argument("invalid property change for record " +
                                    change.recordIdentifier() + ": " + pc.description());
    }
  }

  const double now = nowSeconds();
  Transaction t(db_);
  const int64_t anchor = anchorOf(client, dataclass, nullptr);
  Statement read(db_.handle(), "SELECT properties FROM records WHERE dataclass = ?1 AND id = ?2");
  Statement write(db_.handle(),
                  "INSERT INTO records (dataclass, id, properties) VALUES (?1, ?2, ?3) "
                  "ON CONFLICT(dataclass, id) DO UPDATE SET properties = excluded.properties");
  Statement remove(db_.handle(), "DELETE FROM records WHERE dataclass = ?1 AND id = ?2");
  Statement bury(db_.handle(),
                 "INSERT OR REPLACE INTO tombstones (dataclass, id, properties, deleted) "
                 "VALUES (?1, ?2, ?3, ?4)");
  Statement exhume(db_.handle(),
                   "SELECT properties FROM tombstones WHERE dataclass = ?1 AND id = ?2");
  Statement forget(db_.handle(), "DELETE FROM tombstones WHERE dataclass = ?1 AND id = ?2");
  Statement unseenDelete(db_.handle(),
                         "SELECT client, origin FROM journal WHERE dataclass = ?1 AND record = ?2 "
                         "AND seq > ?3 AND client != ?4 AND type = 3 ORDER BY seq DESC LIMIT 1");
  Statement lastDelete(db_.handle(),
                       "SELECT client, origin FROM journal WHERE dataclass = ?1 AND record = ?2 "
                       "AND type = 3 ORDER BY seq DESC LIMIT 1");
  Statement unseen(db_.handle(),
                   "SELECT client, changes, pushed, origin FROM journal WHERE dataclass = ?1 AND "
                   "record = ?2 AND seq > ?3 AND client != ?4 ORDER BY seq");
  Statement journal(
      db_.handle(),
      "INSERT INTO journal (dataclass, record, client, type, changes, pushed, origin) "
      "VALUES (?1, ?2, ?3, ?4, ?5, ?6, ?7)");

  for (const SyncEngineChange& change : changes) {
    const std::string& id = change.recordIdentifier();
    read.bind(1, dataclass).bind(2, id);
    const bool exists = read.step();
    Dictionary properties = exists ? decode(read.blob(0)).dictionary() : Dictionary{};
    read.reset();

    uint32_t type = change.type();
    // What other clients did to this record that this client has not seen.
    std::map<std::string, Competing> competing;
    auto readCompeting = [&] {
      unseen.bind(1, dataclass).bind(2, id).bind(3, anchor).bind(4, client);
      while (unseen.step()) {
        const Value list = decode(unseen.blob(1));
        for (const Value& pc : list.array()) {
          const Dictionary& d = pc.dictionary();
          competing[d.get("name").string()] = {d.get("value"), unseen.text(0), unseen.text(3),
                                               unseen.real(2)};
        }
      }
      unseen.reset();
    };
    auto tell = [&](Conflict c) {
      if (options.onConflict) options.onConflict(c);
    };

    if (type == SyncEngineChange::kDelete) {
      if (!exists) {
        VTC_LOG_DEBUG("Ignoring the delete of unknown record %@ in %@", id, dataclass);
        continue;
      }
      // Edits of others not seen here lose to the delete, and are kept.
      readCompeting();
      for (const auto& [name, other] : competing) {
        VTC_LOG_INFO("Conflict on %@ of record %@ in %@: deleted by %@, dropped %@ from %@", name,
                     id, dataclass, client, other.value, other.client);
        tell({dataclass, id, name, Value(), other.value, client, other.client, options.origin,
              other.origin, currentClock().now()});
      }
      remove.bind(1, dataclass).bind(2, id).run();
      bury.bind(1, dataclass).bind(2, id).bind(3, encode(Value(properties))).bind(4, now).run();
      journal.bind(1, dataclass).bind(2, id).bind(3, client).bind(4, int64_t{type});
      journal.bind(5, encode(Value(Array{}))).bind(6, now).bind(7, options.origin).run();
      continue;
    }
    if (!exists) {
      // A change of a record that is not here adds it. A modify of a deleted
      // one brings it back whole, as it was, with the change on top (an add
      // carries the whole record itself).
      bool restored = false;
      if (type == SyncEngineChange::kModify) {
        exhume.bind(1, dataclass).bind(2, id);
        restored = exhume.step();
        if (restored) properties = decode(exhume.blob(0)).dictionary();
        exhume.reset();
      }
      type = SyncEngineChange::kAdd;
      forget.bind(1, dataclass).bind(2, id).run();
      // The delete undone: for a restored record the last one, even one this
      // pusher has seen (its user deleted it, then an edit made elsewhere
      // before the delete was seen brought it back); for an add, one it has
      // not seen.
      Statement& undone = restored ? lastDelete : unseenDelete;
      undone.bind(1, dataclass).bind(2, id);
      if (!restored) undone.bind(3, anchor).bind(4, client);
      if (undone.step() && undone.text(0) != client) {
        VTC_LOG_INFO("Conflict on record %@ in %@: restored by %@, deleted by %@", id, dataclass,
                     client, undone.text(0));
        tell({dataclass, id, "(record)", Value("restored"), Value("deleted"), client,
              undone.text(0), options.origin, undone.text(1), currentClock().now()});
      }
      undone.reset();
    }

    if (exists) readCompeting();

    Array applied;
    for (const Value& pc : change.changes()) {
      const Dictionary& d = pc.dictionary();
      const std::string& name = d.get("name").string();
      const Value& value = d.get("value");
      auto other = competing.find(name);
      if (other != competing.end() && !(other->second.value == value)) {
        const bool oursWins = now > other->second.pushed ||
                              (now == other->second.pushed && client > other->second.client);
        const Value& kept = oursWins ? value : other->second.value;
        const Value& lost = oursWins ? other->second.value : value;
        VTC_LOG_INFO("Conflict on %@ of record %@ in %@: kept %@ from %@, dropped %@ from %@", name,
                     id, dataclass, kept, oursWins ? client : other->second.client, lost,
                     oursWins ? other->second.client : client);
        if (options.onConflict) {
          Conflict c{dataclass, id, name, kept, lost, {}, {}, {}, {}, currentClock().now()};
          c.keptClient = oursWins ? client : other->second.client;
          c.lostClient = oursWins ? other->second.client : client;
          c.keptOrigin = oursWins ? options.origin : other->second.origin;
          c.lostOrigin = oursWins ? other->second.origin : options.origin;
          options.onConflict(c);
        }
        if (!oursWins) continue;
      }
      if (d.get("action").string() == "set")
        properties.set(name, value);
      else
        properties.erase(name);
      applied.push_back(pc);
    }
    write.bind(1, dataclass).bind(2, id).bind(3, encode(Value(properties))).run();
    journal.bind(1, dataclass).bind(2, id).bind(3, client).bind(4, int64_t{type});
    journal.bind(5, encode(Value(applied))).bind(6, now).bind(7, options.origin).run();
  }
  Statement purge(db_.handle(), "DELETE FROM tombstones WHERE deleted < ?1");
  purge.bind(1, now - kTombstoneSeconds).run();
  writeState(client, dataclass, options.state);
  t.commit();
}

}  // namespace vtc::engine
