#include "client/merge/Restore.h"

#include <algorithm>

#include "client/items/ItemRecord.h"
#include "client/items/Meaning.h"
#include "client/merge/RecordMerge.h"

namespace vtc::client::merge {

namespace {

// A component's units, read from its bytes inside a calendar frame.
std::optional<Dictionary> componentUnits(std::string_view bytes, std::string_view scope) {
  const std::string calendar =
      "BEGIN:VCALENDAR\r\nVERSION:2.0\r\n" + std::string(bytes) + "END:VCALENDAR\r\n";
  std::optional<Dictionary> record = recordOfBytes(ItemKind::Calendars, calendar, "");
  if (!record) return std::nullopt;
  Dictionary units;
  for (const auto& [key, value] : *record)
    if (scopeOf(key) == scope) units.set(key, value);
  return units;
}

}  // namespace

std::optional<Dictionary> restoredRecord(ItemKind kind, const std::optional<Dictionary>& current,
                                         const std::string& field, const Value& lost,
                                         const Dictionary& item) {
  Dictionary record = current ? *current : item;
  if (field == kRecordField) {
    if (!lost.isDictionary()) return std::nullopt;  // the delete lost: it is made again
    Dictionary whole = lost.dictionary();
    if (!recordFile(record).empty()) whole.set(kFileField, Value(recordFile(record)));
    return whole;
  }
  if (nameOf(field) != kComponentName) {
    if (lost.isNone())
      record.erase(field);
    else
      record.set(field, lost);  // the order places a unit it does not name
    return record;
  }
  // A whole component: its units replace the ones there now, in their place.
  const std::string_view scope = scopeOf(field);
  std::vector<std::string> order = recordOrder(record);
  auto first = std::find_if(order.begin(), order.end(),
                            [&](const std::string& k) { return scopeOf(k) == scope; });
  const size_t at = static_cast<size_t>(first - order.begin());
  std::erase_if(order, [&](const std::string& k) { return scopeOf(k) == scope; });
  for (const std::string& key : record.keys())
    if (scopeOf(key) == scope) record.erase(key);
  if (!lost.isNone() && kind == ItemKind::Calendars) {
    std::optional<Dictionary> units = componentUnits(rawOf(lost), scope);
    if (units) {
      std::vector<std::string> placed;
      for (const auto& [key, value] : *units) {
        record.set(key, value);
        placed.push_back(key);
      }
      // In the component's old place, else before the item's end.
      size_t where = std::min(at, order.size());
      if (first == order.end() || at > order.size()) {
        auto end = std::find(order.begin(), order.end(), std::string(kEnd));
        where = static_cast<size_t>(end - order.begin());
      }
      order.insert(order.begin() + static_cast<std::ptrdiff_t>(where), placed.begin(),
                   placed.end());
    }
  }
  record.set(kOrderField, Value(joinOrder(order)));
  return record;
}

}  // namespace vtc::client::merge
