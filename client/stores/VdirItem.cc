#include "client/stores/VdirItem.h"

#include <algorithm>
#include <map>
#include <stdexcept>
#include <unordered_map>
#include <utility>
#include <vector>

#include "client/stores/ContentLines.h"
#include "client/stores/ItemLayout.h"
#include "common/Format.h"

namespace vtc::client {

namespace {

using Role = ItemUnit::Role;

// What a new item starts from before the changes are applied: its frame
// and the lines the formats require (a set of the same field replaces them).
constexpr char kNewCard[] = "BEGIN:VCARD\r\nVERSION:3.0\r\nEND:VCARD\r\n";
constexpr char kNewCalendar[] =
    "BEGIN:VCALENDAR\r\nVERSION:2.0\r\nPRODID:-//Nubilo//nubilosyncclient//EN\r\nEND:VCALENDAR\r\n";

// The outcome of all changes of one field: its new lines, or none to clear it.
struct FieldChange {
  std::string key;
  std::optional<std::string> lines;
};

// The changes in order of each field's first change; a later change of a
// field overrides an earlier one.
std::vector<FieldChange> readChanges(const Array& propertyChanges) {
  std::vector<FieldChange> changes;
  std::unordered_map<std::string, size_t> index;
  for (const Value& change : propertyChanges) {
    const Dictionary& d = change.dictionary();
    const std::string& action = d.get("action").string();
    const std::string& name = d.get("name").string();
    const Value& value = d.get("value");
    if (name.empty() || (action != "set" && action != "clear") ||
        (action == "set" && !value.isString()))
      throw std::invalid_argument(format("Not a field change: %@", change));
    auto [it, added] = index.emplace(name, changes.size());
    if (added) changes.push_back({name, std::nullopt});
    std::optional<std::string>& lines = changes[it->second].lines;
    lines.reset();
    if (action == "set") appendConformingLines(lines.emplace(), value.string());
  }
  return changes;
}

bool startsComponent(std::string_view lines) {
  return upperCase(lineName(lines)) == "BEGIN";
}

// Where new lines go, by the field's kind. Several insertions before one
// unit are ordered by rank: properties first, then time zones or nested
// components (alarms), then events.
struct Anchor {
  size_t unit;
  int rank;
  friend auto operator<=>(const Anchor&, const Anchor&) = default;
};

class ItemEditor {
 public:
  ItemEditor(ItemKind kind, const ItemLayout& layout) : kind_(kind), layout_(layout) {
    for (size_t i = 0; i < layout.units.size(); ++i) {
      const ItemUnit& unit = layout.units[i];
      Component& c = components_[unit.container];
      if (!unit.key.empty() && firstUnit_.emplace(unit.key, i).second) ++c.fields;
      if (unit.role == Role::End) c.end = i;
      if (unit.role == Role::Block && !c.firstBlock) c.firstBlock = i;
      bool event = !unit.container.empty() && unit.role == Role::Begin;
      bool timeZone = unit.container.empty() && unit.role == Role::Block;
      if (event && !firstEvent_) firstEvent_ = i;
      if ((event || timeZone) && !firstComponent_) firstComponent_ = i;
    }
  }

  std::string apply(const std::vector<FieldChange>& changes) {
    for (const FieldChange& change : changes) {
      auto existing = firstUnit_.find(change.key);
      if (existing != firstUnit_.end()) {
        bool same = change.lines && *change.lines == layout_.fields.get(change.key).string();
        if (!same) changed_.emplace(change.key, &change.lines);
        if (!change.lines) --components_[layout_.units[existing->second].container].fields;
      } else if (change.lines) {
        place(change.key, *change.lines);
      }
    }
    for (auto& [name, lines] : newComponents_) {
      std::string kind = name.substr(0, name.find('/'));
      inserts_[{top().end, 2}] +=
          "BEGIN:" + kind + "\r\n" + lines.properties + lines.blocks + "END:" + kind + "\r\n";
    }
    return write();
  }

 private:
  struct Component {
    size_t end = 0;
    std::optional<size_t> firstBlock;
    int fields = 0;  // the fields it keeps
  };
  struct NewComponent {
    std::string properties, blocks;
  };

  ItemKind kind_;
  const ItemLayout& layout_;
  std::unordered_map<std::string, size_t> firstUnit_;  // key -> its first unit
  std::map<std::string, Component> components_;        // "" is the item's own level
  std::optional<size_t> firstComponent_, firstEvent_;  // at the calendar's level
  std::map<std::string, const std::optional<std::string>*> changed_;
  std::map<Anchor, std::string> inserts_;
  std::vector<std::pair<std::string, NewComponent>> newComponents_;

  const Component& top() { return components_[""]; }

  // A new field goes before the END of its component; properties go before
  // the component's nested components, and the calendar's own properties
  // and time zones before its events.
  void place(const std::string& key, const std::string& lines) {
    if (kind_ == ItemKind::Contacts) {
      inserts_[{top().end, 0}] += lines;
    } else if (key.starts_with(kCalendarPrefix)) {
      inserts_[{firstComponent_.value_or(top().end), 0}] += lines;
    } else if (key.starts_with(kTimeZonePrefix)) {
      inserts_[{firstEvent_.value_or(top().end), 1}] += lines;
    } else {
      size_t slash = key.rfind('/');
      if (slash == std::string::npos || key.find('/') == slash)
        throw std::invalid_argument(format("Not a calendar field: %@", key));
      std::string container = key.substr(0, slash);
      bool block = startsComponent(lines);
      auto existing = components_.find(container);
      if (existing != components_.end() && !container.empty()) {
        Component& c = existing->second;
        ++c.fields;
        inserts_[{block ? c.end : c.firstBlock.value_or(c.end), block ? 1 : 0}] += lines;
        return;
      }
      auto it = std::find_if(newComponents_.begin(), newComponents_.end(),
                             [&](const auto& entry) { return entry.first == container; });
      if (it == newComponents_.end()) it = newComponents_.insert(it, {container, {}});
      (block ? it->second.blocks : it->second.properties) += lines;
    }
  }

  std::string write() {
    std::string out;
    auto insert = inserts_.begin();
    for (size_t i = 0; i < layout_.units.size(); ++i) {
      for (; insert != inserts_.end() && insert->first.unit == i; ++insert) out += insert->second;
      const ItemUnit& unit = layout_.units[i];
      if (!unit.container.empty() && components_[unit.container].fields == 0) continue;
      auto change = unit.key.empty() ? changed_.end() : changed_.find(unit.key);
      if (change == changed_.end()) {
        out += unit.raw;
      } else if (*change->second && firstUnit_[unit.key] == i) {
        out += **change->second;
      }
    }
    return out;
  }
};

// The edit must leave exactly the fields it names as they were asked for;
// anything else means a value does not belong under its key.
void checkResult(ItemKind kind, const std::string& bytes, const std::vector<FieldChange>& changes) {
  std::string problem;
  std::optional<ItemLayout> result = readItemLayout(kind, bytes, &problem);
  if (!result) throw std::invalid_argument("The changes make an invalid item: " + problem);
  for (const FieldChange& change : changes) {
    const Value* now = result->fields.find(change.key);
    bool fits = change.lines ? (now && now->string() == *change.lines) : now == nullptr;
    if (!fits)
      throw std::invalid_argument(
          format("The value given for %@ does not fit that field", change.key));
  }
}

}  // namespace

std::optional<Dictionary> splitItem(ItemKind kind, std::string_view bytes) {
  std::optional<ItemLayout> layout = readItemLayout(kind, bytes);
  if (!layout) return std::nullopt;
  return std::move(layout->fields);
}

std::string applyFieldChanges(ItemKind kind, const std::optional<std::string>& current,
                              const Array& propertyChanges) {
  if (current && propertyChanges.empty()) return *current;
  std::vector<FieldChange> changes = readChanges(propertyChanges);
  std::string_view bytes =
      current ? std::string_view(*current)
              : std::string_view(kind == ItemKind::Contacts ? kNewCard : kNewCalendar);
  std::string problem;
  std::optional<ItemLayout> layout = readItemLayout(kind, bytes, &problem);
  if (!layout) throw std::invalid_argument("The item to change is not valid: " + problem);
  std::string out = ItemEditor(kind, *layout).apply(changes);
  checkResult(kind, out, changes);
  return out;
}

}  // namespace vtc::client
