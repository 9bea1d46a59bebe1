#include "client/run/ConflictStore.h"

#include <algorithm>
#include <filesystem>
#include <stdexcept>

#include "client/run/SupportFolder.h"
#include "common/Uuid.h"
#include "platform/fs/LocalPaths.h"
#include "platform/plist/PlistCodec.h"

namespace vtc::client {

namespace {

Value toValue(const KeptConflict& c) {
  Dictionary d{{"ID", c.id},
               {"Dataclass", c.dataclass},
               {"Record", c.record},
               {"File", c.file},
               {"Name", c.name},
               {"Field", c.field},
               {"KeptComputer", c.keptComputer},
               {"Computer", c.lostComputer},
               {"Date", Value(c.date)},
               {"Item", Value(c.item)}};
  if (!c.kept.isNone()) d.set("Kept", c.kept);
  if (!c.lost.isNone()) d.set("Lost", c.lost);
  return Value(d);
}

std::optional<KeptConflict> fromValue(const Value& v) {
  const Dictionary& d = v.dictionary();
  if (!d.get("ID").isString()) return std::nullopt;
  return KeptConflict{d.get("ID").string(),
                      d.get("Dataclass").string(),
                      d.get("Record").string(),
                      d.get("File").string(),
                      d.get("Name").string(),
                      d.get("Field").string(),
                      d.get("Kept"),
                      d.get("Lost"),
                      d.get("Item").dictionary(),
                      d.get("KeptComputer").string(),
                      d.get("Computer").string(),
                      d.get("Date").date()};
}

}  // namespace

ConflictStore::ConflictStore() : ConflictStore(paths::join(supportFolder(), "Conflicts")) {}

ConflictStore::ConflictStore(std::string folder) : folder_(std::move(folder)) {}

KeptConflict ConflictStore::keep(KeptConflict kept) {
  kept.id = makeUUIDString().substr(0, 8);
  std::transform(kept.id.begin(), kept.id.end(), kept.id.begin(),
                 [](unsigned char c) { return static_cast<char>(std::tolower(c)); });
  paths::makeDirectories(folder_, 0700);
  if (!plist::writeFileAtomically(paths::join(folder_, kept.id + ".plist"), toValue(kept)))
    throw std::runtime_error("cannot keep a conflict's losing value in " + folder_);
  return kept;
}

std::vector<KeptConflict> ConflictStore::list() const {
  std::vector<KeptConflict> all;
  std::error_code error;
  for (auto it = std::filesystem::directory_iterator(folder_, error);
       !error && it != std::filesystem::directory_iterator(); it.increment(error)) {
    if (it->path().extension() != ".plist") continue;
    if (auto value = plist::readFile(it->path().string()))
      if (auto c = fromValue(*value)) all.push_back(std::move(*c));
  }
  std::sort(all.begin(), all.end(), [](const auto& a, const auto& b) {
    return a.date != b.date ? a.date < b.date : a.id < b.id;
  });
  return all;
}

std::optional<KeptConflict> ConflictStore::find(const std::string& id) const {
  auto value = plist::readFile(paths::join(folder_, id + ".plist"));
  if (!value || id.find('/') != std::string::npos) return std::nullopt;
  return fromValue(*value);
}

bool ConflictStore::drop(const std::string& id) {
  if (id.empty() || id.find('/') != std::string::npos) return false;
  std::error_code error;
  return std::filesystem::remove(paths::join(folder_, id + ".plist"), error);
}

}  // namespace vtc::client
