#include "client/run/Collections.h"

#include "VantorSyncManager/PublicNames.h"
#include "client/run/SyncFailure.h"
#include "common/Logging.h"
#include "platform/prefs/PreferenceStore.h"
#include "session/DataclassName.h"

namespace vtc::client {

namespace {

constexpr const char* kKey = "SyncCollections";

using prefs::PreferenceStore;
using prefs::Scope;

Dictionary stored() {
  return PreferenceStore::shared()
      .copyValue(kKey, kVantorDefaultsKey, Scope::CurrentHost)
      .dictionary();
}

void store(const Dictionary& all) {
  auto& store = PreferenceStore::shared();
  store.setValue(kKey, Value(all), kVantorDefaultsKey, Scope::CurrentHost);
  store.synchronize(kVantorDefaultsKey, Scope::CurrentHost);
}

}  // namespace

std::optional<ItemKind> kindFromWord(const std::string& word) {
  if (word == "contacts") return ItemKind::Contacts;
  if (word == "calendars") return ItemKind::Calendars;
  return std::nullopt;
}

const char* kindWord(ItemKind kind) {
  return kind == ItemKind::Contacts ? "contacts" : "calendars";
}

void requirePlainDataclassName(const std::string& dataclass) {
  const std::string problem = dataclassNameProblem(dataclass);
  if (!problem.empty())
    throw SyncFailure(FailureKind::Usage,
                      "A dataclass name is a plain name of letters, digits, '.', '_' and '-', "
                      "not starting with '.' and at most " +
                          std::to_string(kMaxDataclassNameLength) +
                          " long; this one is not: " + problem + ".");
}

std::vector<Collection> configuredCollections() {
  std::vector<Collection> all;
  for (const auto& [dataclass, entry] : stored()) {
    if (!isPlainDataclassName(dataclass)) {
      VTC_LOG_WARNING("Ignoring a synced folder whose dataclass name is not plain: %@",
                      dataclassNameProblem(dataclass));
      continue;
    }
    auto kind = kindFromWord(entry.dictionary().get("Kind").string());
    const std::string& folder = entry.dictionary().get("Folder").string();
    if (kind && !folder.empty()) all.push_back({dataclass, *kind, folder});
  }
  return all;
}

std::optional<Collection> configuredCollection(const std::string& dataclass) {
  for (Collection& c : configuredCollections())
    if (c.dataclass == dataclass) return c;
  return std::nullopt;
}

void addCollection(const Collection& collection) {
  requirePlainDataclassName(collection.dataclass);
  Dictionary all = stored();
  if (all.contains(collection.dataclass))
    throw SyncFailure(FailureKind::Usage,
                      collection.dataclass + " is already synced with " +
                          all.get(collection.dataclass).dictionary().get("Folder").string() +
                          "; give this folder a name of its own with --dataclass NAME.");
  for (const Collection& c : configuredCollections())
    if (c.folder == collection.folder)
      throw SyncFailure(FailureKind::Usage,
                        collection.folder + " is already synced as " + c.dataclass + ".");
  all.set(collection.dataclass,
          Value(Dictionary{{"Kind", kindWord(collection.kind)}, {"Folder", collection.folder}}));
  store(all);
}

bool removeCollection(const std::string& dataclass) {
  Dictionary all = stored();
  if (!all.erase(dataclass)) return false;
  store(all);
  return true;
}

}  // namespace vtc::client
