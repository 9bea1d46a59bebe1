#include "client/run/FolderRead.h"

#include <set>

#include "client/items/ItemRecord.h"
#include "common/Logging.h"

namespace vtc::client {

std::map<std::string, ItemState> knownFiles(engine::SyncEngine& engine, const std::string& client,
                                            const std::string& dataclass) {
  std::map<std::string, ItemState> known;
  for (auto& [name, stamp] : engine.itemStamps(client, dataclass))
    known.emplace_hint(
        known.end(), name,
        ItemState{stamp.size, stamp.modified, stamp.changed, stamp.inode, std::move(stamp.record)});
  return known;
}

FolderRead readFolder(const VdirCollection& folder, engine::SyncEngine& engine,
                      const std::string& client, const std::string& dataclass) {
  FolderRead result;
  std::map<std::string, ItemState> known = knownFiles(engine, client, dataclass);
  result.knownFiles = known.size();
  result.scan = folder.scan(known);
  ScanResult& scan = result.scan;
  result.invalid = scan.invalid;

  // Who holds each identity now: the files read, and the unchanged ones.
  std::map<std::string, std::vector<std::string>> holders;
  for (auto& [name, state] : scan.states) {
    auto read = scan.read.find(name);
    if (read != scan.read.end()) state.record = recordIdentity(read->second->text, name);
    holders[state.record].push_back(name);
  }
  // Two files of one item: neither is taken until the user keeps one.
  for (const auto& [identity, names] : holders) {
    if (names.size() < 2) continue;
    for (const std::string& name : names) {
      if (!scan.read.count(name)) continue;
      std::string other = names.front() == name ? names.back() : names.front();
      const std::string why = "it holds the same item (UID " + identity + ") as " + other;
      VTC_LOG_WARNING("Skipping %@ in %@: %@", name, folder.folder(), why);
      result.invalid.emplace_back(name, why);
      scan.read.erase(name);
      auto before = known.find(name);
      if (before != known.end())
        scan.states[name] = before->second;
      else
        scan.states.erase(name);
    }
  }

  // The records the files held before: of files read again and of files gone.
  std::vector<std::string> names;
  for (const auto& [name, file] : scan.read)
    if (known.count(name)) names.push_back(name);
  for (const std::string& name : scan.deleted) names.push_back(name);
  std::map<std::string, Value> details = engine.itemDetails(client, dataclass, names);
  auto detailOf = [&](const std::string& name) -> std::optional<Dictionary> {
    auto it = details.find(name);
    if (it == details.end() || !it->second.isDictionary()) return std::nullopt;
    return it->second.dictionary();
  };

  for (const auto& [name, file] : scan.read) {
    const std::string& identity = scan.states.at(name).record;
    LocalRecord& local = result.records[identity];
    local.now = file.get();
    local.file = name;
    auto was = known.find(name);
    if (was == known.end()) continue;
    if (was->second.record == identity) {
      local.before = detailOf(name);
    } else {
      // The file now holds another item: the one it held is gone from it.
      LocalRecord& old = result.records[was->second.record];
      if (!old.now) {
        old.before = detailOf(name);
        old.file = name;
      }
    }
  }
  for (const std::string& name : scan.deleted) {
    const std::string& identity = known.at(name).record;
    LocalRecord& local = result.records[identity];
    if (local.now && !local.before) {
      local.before = detailOf(name);  // renamed: the same item in a file of another name
      local.oldFile = name;
    } else if (!local.now) {
      local.before = detailOf(name);
      local.file = name;
    }
  }
  return result;
}

}  // namespace vtc::client
