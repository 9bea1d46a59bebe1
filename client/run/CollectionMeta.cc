#include "client/run/CollectionMeta.h"

#include <filesystem>
#include <fstream>

#include "VantorSyncManager/NubiloException.h"
#include "VantorSyncManager/NubiloRemoteSession.h"
#include "VantorSyncManager/PublicNames.h"
#include "common/Logging.h"
#include "platform/fs/AtomicWrite.h"
#include "platform/fs/LocalPaths.h"
#include "platform/prefs/PreferenceStore.h"

namespace vtc::client {

namespace {

constexpr size_t kLongest = 1024;

std::string knownKey(const std::string& dataclass) {
  return "CollectionMeta." + dataclass;
}

std::optional<std::string> readLine(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  if (!in) return std::nullopt;
  std::string line(kLongest + 1, '\0');
  in.read(line.data(), static_cast<std::streamsize>(line.size()));
  line.resize(static_cast<size_t>(in.gcount()));
  if (line.size() > kLongest) return std::nullopt;
  line = line.substr(0, line.find_first_of("\r\n"));
  while (!line.empty() && (line.back() == ' ' || line.back() == '\t')) line.pop_back();
  if (line.empty()) return std::nullopt;
  return line;
}

std::optional<std::string> valueIn(const Dictionary& d, const char* key) {
  const Value& v = d.get(key);
  if (!v.isString() || v.string().empty()) return std::nullopt;
  return v.string();
}

void writeFile(const std::string& folder, const char* name, const std::optional<std::string>& v) {
  const std::string path = paths::join(folder, name);
  if (!v) {
    std::error_code ignored;
    std::filesystem::remove(path, ignored);
    return;
  }
  if (!fs::writeFileAtomically(path, *v + "\n")) VTC_LOG_WARNING("Could not write %@", path);
}

}  // namespace

CollectionMeta readFolderMeta(const std::string& folder) {
  return {readLine(paths::join(folder, "displayname")), readLine(paths::join(folder, "color"))};
}

void syncCollectionMeta(NubiloRemoteSession& session, const Collection& collection,
                        const CollectionMeta& share) {
  auto& store = prefs::PreferenceStore::shared();
  const Value stored = store.copyValue(knownKey(collection.dataclass), kVantorDefaultsKey,
                                       prefs::Scope::CurrentHost);
  const CollectionMeta known{valueIn(stored.dictionary(), "displayname"),
                             valueIn(stored.dictionary(), "color")};
  const CollectionMeta here = readFolderMeta(collection.folder);
  if (here == share && share == known) return;

  CollectionMeta agreed;
  Dictionary send;
  struct Field {
    const char* file;
    const char* property;
    std::optional<std::string> CollectionMeta::*member;
  };
  for (const Field& f :
       {Field{"displayname", kCollectionNameProperty, &CollectionMeta::displayname},
        Field{"color", kCollectionColorProperty, &CollectionMeta::color}}) {
    const auto& mine = here.*f.member;
    const auto& theirs = share.*f.member;
    const auto& before = known.*f.member;
    if (mine != theirs && mine != before && theirs == before) {
      send.set(f.property, Value(mine.value_or("")));
      agreed.*f.member = mine;
    } else {
      if (mine != theirs) writeFile(collection.folder, f.file, theirs);
      agreed.*f.member = theirs;
    }
  }
  try {
    if (!send.empty() && !session.setInfoForDataclass(send, collection.dataclass)) {
      VTC_LOG_WARNING("The share did not take the folder's name or colour of %@",
                      collection.dataclass);
      return;  // tried again next sync
    }
  } catch (const NubiloException& e) {
    VTC_LOG_WARNING("The folder's name or colour of %@ was not sent: %@", collection.dataclass,
                    e.reason());
    return;
  }
  Dictionary record;
  if (agreed.displayname) record.set("displayname", Value(*agreed.displayname));
  if (agreed.color) record.set("color", Value(*agreed.color));
  store.setValue(knownKey(collection.dataclass), Value(record), kVantorDefaultsKey,
                 prefs::Scope::CurrentHost);
  store.synchronize(kVantorDefaultsKey, prefs::Scope::CurrentHost);
}

}  // namespace vtc::client
