// Pulling changes out of the engine: what other clients did since this
// client's anchor, one coalesced change per record carrying current values;
// or, after a reset, the whole truth as adds. The cost follows the journal
// since the anchor, not the size of the store.
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

// What the journal since the anchor says of one record, from the pulling
// client's side.
struct Touched {
  bool clientHas = false;          // the client holds the record as it stands now (or as it stood)
  bool replaced = false;           // others deleted it and it came back: the client's copy is stale
  std::vector<std::string> order;  // property names in first-change order
  std::map<std::string, bool> lastWriterIsClient;  // name -> whether the client wrote it last
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
    result.changes = records(dataclass);
    result.isTruth = true;
    t.commit();
    return result;
  }

  // Every entry since the anchor, the client's own included: they tell which
  // values the client already has, so that it is never sent its own.
  Statement entries(db_.handle(),
                    "SELECT record, type, changes, client FROM journal WHERE dataclass = ?1 AND "
                    "seq > ?2 ORDER BY seq");
  entries.bind(1, dataclass).bind(2, anchor);
  std::vector<std::string> recordOrder;
  std::map<std::string, Touched> touched;
  while (entries.step()) {
    std::string id = entries.text(0);
    const int64_t type = entries.integer(1);
    const bool own = entries.text(3) == client;
    auto [it, fresh] = touched.try_emplace(id);
    Touched& rec = it->second;
    if (fresh) {
      recordOrder.push_back(id);
      // An add is journalled only for a record that did not exist; anything
      // else means the record existed at the anchor, when the client had it.
      rec.clientHas = type != SyncEngineChange::kAdd;
    }
    if (type == SyncEngineChange::kAdd) {
      if (own)
        rec.clientHas = true;
      else if (rec.clientHas)
        rec.replaced = true;
    } else if (type == SyncEngineChange::kDelete) {
      if (own) rec.clientHas = false;
      rec.replaced = false;
      rec.order.clear();
      rec.lastWriterIsClient.clear();
      continue;
    }
    const Value list = decode(entries.blob(2));
    for (const Value& pc : list.array()) {
      const std::string& name = pc.dictionary().get("name").string();
      if (!rec.lastWriterIsClient.count(name)) rec.order.push_back(name);
      rec.lastWriterIsClient[name] = own;
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
      if (rec.clientHas) result.changes.emplace_back(SyncEngineChange::kDelete, id, Array{});
    } else if (!rec.clientHas || rec.replaced) {
      result.changes.emplace_back(SyncEngineChange::kAdd, id, setsOf(properties));
    } else {
      // The current value of each property that another client wrote last;
      // edits that all lost a conflict change nothing.
      Array merged;
      for (const std::string& name : rec.order) {
        if (rec.lastWriterIsClient.at(name)) continue;
        if (const Value* value = properties.find(name))
          merged.push_back(Value(Dictionary{{"action", "set"}, {"name", name}, {"value", *value}}));
        else
          merged.push_back(Value(Dictionary{{"action", "clear"}, {"name", name}}));
      }
      if (!merged.empty())
        result.changes.emplace_back(SyncEngineChange::kModify, id, std::move(merged));
    }
  }
  t.commit();
  return result;
}

}  // namespace vtc::engine
