// Pulling changes out of the engine: what other clients pushed since this
// client's anchor, one coalesced change per record; or, after a reset, the
// whole truth as adds. The cost follows the journal since the anchor, not
// the size of the store.
#include <map>
#include <vector>

#include "platform/engine/SqliteEngine.h"

namespace vtc::engine {

namespace {

Array setsOf(const Dictionary& properties) {
  Array out;
  for (const auto& [name, value] : properties)
    out.push_back(Value(Dictionary{{"action", "set"}, {"name", name}, {"value", value}}));
  return out;
}

struct Touched {
  bool addedInWindow = false;
  std::vector<std::string> order;           // property names in first-change order
  std::map<std::string, Value> lastChange;  // name -> the last property change
};

}  // namespace

PullResult SqliteEngine::pull(const std::string& client, const std::string& dataclass) {
  Transaction t(db_);  // one consistent view of records and journal
  PullResult result;
  Statement top(db_.handle(), "SELECT IFNULL(MAX(seq), 0) FROM journal WHERE dataclass = ?1");
  top.bind(1, dataclass);
  top.step();
  result.anchor = top.integer(0);
  top.reset();

  bool needsTruth = false;
  const int64_t anchor = anchorOf(client, dataclass, &needsTruth);
  if (needsTruth) {
    Statement all(db_.handle(), "SELECT id, properties FROM records WHERE dataclass = ?1");
    all.bind(1, dataclass);
    while (all.step())
      result.changes.emplace_back(SyncEngineChange::kAdd, all.text(0),
                                  setsOf(decode(all.blob(1)).dictionary()));
    t.commit();
    return result;
  }

  Statement entries(db_.handle(),
                    "SELECT record, type, changes FROM journal WHERE dataclass = ?1 AND seq > ?2 "
                    "AND client != ?3 ORDER BY seq");
  entries.bind(1, dataclass).bind(2, anchor).bind(3, client);
  std::vector<std::string> recordOrder;
  std::map<std::string, Touched> touched;
  while (entries.step()) {
    std::string id = entries.text(0);
    auto [it, fresh] = touched.try_emplace(id);
    if (fresh) recordOrder.push_back(id);
    Touched& rec = it->second;
    if (entries.integer(1) == SyncEngineChange::kAdd) rec.addedInWindow = true;
    const Value list = decode(entries.blob(2));
    for (const Value& pc : list.array()) {
      const std::string& name = pc.dictionary().get("name").string();
      if (!rec.lastChange.count(name)) rec.order.push_back(name);
      rec.lastChange[name] = pc;
    }
  }
  entries.reset();

  Statement current(db_.handle(),
                    "SELECT properties FROM records WHERE dataclass = ?1 AND id = ?2");
  for (const std::string& id : recordOrder) {
    const Touched& rec = touched[id];
    current.bind(1, dataclass).bind(2, id);
    const bool exists = current.step();
    Dictionary properties = exists ? decode(current.blob(0)).dictionary() : Dictionary{};
    current.reset();
    if (!exists) {
      // Added and deleted since the anchor: the client never saw it.
      if (!rec.addedInWindow) result.changes.emplace_back(SyncEngineChange::kDelete, id, Array{});
    } else if (rec.addedInWindow) {
      result.changes.emplace_back(SyncEngineChange::kAdd, id, setsOf(properties));
    } else if (!rec.order.empty()) {  // edits that all lost a conflict change nothing
      Array merged;
      for (const std::string& name : rec.order) merged.push_back(rec.lastChange.at(name));
      result.changes.emplace_back(SyncEngineChange::kModify, id, std::move(merged));
    }
  }
  t.commit();
  return result;
}

}  // namespace vtc::engine
