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
    if (type == SyncEngineChange::kDelete) {
      if (!exists) {
        VTC_LOG_DEBUG("Ignoring the delete of unknown record %@ in %@", id, dataclass);
        continue;
      }
      remove.bind(1, dataclass).bind(2, id).run();
      journal.bind(1, dataclass).bind(2, id).bind(3, client).bind(4, int64_t{type});
      journal.bind(5, encode(Value(Array{}))).bind(6, now).bind(7, options.origin).run();
      continue;
    }
    if (!exists) type = SyncEngineChange::kAdd;  // a modify of an unknown record adds it

    // What other clients did to this record that this client has not seen.
    std::map<std::string, Competing> competing;
    if (exists) {
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
    }

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
  writeState(client, dataclass, options.state);
  t.commit();
}

}  // namespace vtc::engine
