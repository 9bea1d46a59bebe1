#include "client/run/SharedConflicts.h"

#include <nlohmann/json.hpp>

#include <algorithm>

#include "client/items/ItemRecord.h"
#include "client/items/Meaning.h"
#include "client/merge/RecordMerge.h"
#include "common/Format.h"

namespace vtc::client {

namespace {

constexpr size_t kMostShared = 40;
constexpr size_t kValueLength = 200;
constexpr size_t kMostText = 256 * 1024;

std::string cut(std::string text) {
  if (text.size() > kValueLength) text = text.substr(0, kValueLength) + "...";
  return text;
}

}  // namespace

std::string conflictValueLine(const Value& value) {
  if (value.isNone()) return "(removed)";
  if (value.isDictionary()) return "(the whole item as it was)";
  std::string text(rawOf(value)), out;
  for (size_t i = 0; i < text.size(); ++i) {
    if (text[i] == '\r') continue;
    if (text[i] == '\n') {
      if (i + 1 < text.size() && (text[i + 1] == ' ' || text[i + 1] == '\t'))
        ++i;  // a folded line goes on
      else if (i + 1 < text.size())
        out += " | ";
      continue;
    }
    out += text[i];
  }
  return out;
}

std::string conflictSubject(const std::string& field) {
  if (field == merge::kRecordField) return "the item";
  if (nameOf(field) == merge::kComponentName) {
    const std::string_view scope = scopeOf(field);
    const size_t first = scope.find('/'), second = scope.find('/', first + 1);
    const std::string_view rid = scope.substr(first + 1, second - first - 1);
    return rid.empty() ? "the series" : "the occurrence of " + std::string(rid);
  }
  return std::string(nameOf(field));
}

std::string sharedConflictsText(const std::vector<KeptConflict>& conflicts) {
  nlohmann::json all = nlohmann::json::array();
  const size_t first = conflicts.size() > kMostShared ? conflicts.size() - kMostShared : 0;
  for (size_t i = conflicts.size(); i-- > first;) {
    const KeptConflict& c = conflicts[i];
    all.push_back({{"id", c.id},
                   {"dataclass", c.dataclass},
                   {"name", cut(c.name)},
                   {"file", cut(c.file)},
                   {"field", conflictSubject(c.field)},
                   {"kept", cut(conflictValueLine(c.kept))},
                   {"lost", cut(conflictValueLine(c.lost))},
                   {"keptComputer", cut(c.keptComputer)},
                   {"lostComputer", cut(c.lostComputer)},
                   {"date", textOf(Value(c.date))}});
  }
  return all.dump(-1, ' ', false, nlohmann::json::error_handler_t::replace);
}

std::vector<SharedConflict> readSharedConflicts(const std::string& computer,
                                                const std::string& text) {
  std::vector<SharedConflict> read;
  if (text.empty() || text.size() > kMostText) return read;
  const nlohmann::json all = nlohmann::json::parse(text, nullptr, false);
  if (!all.is_array()) return read;
  for (const nlohmann::json& c : all) {
    if (!c.is_object() || read.size() >= kMostShared) continue;
    auto field = [&](const char* key) {
      auto it = c.find(key);
      return it != c.end() && it->is_string() ? cut(it->get<std::string>()) : std::string();
    };
    read.push_back(SharedConflict{computer, field("id"), field("dataclass"), field("name"),
                                  field("file"), field("field"), field("kept"), field("lost"),
                                  field("keptComputer"), field("lostComputer"), field("date")});
  }
  return read;
}

}  // namespace vtc::client
