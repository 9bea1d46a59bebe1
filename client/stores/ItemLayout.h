// How an item's bytes are laid out: its lines in file order, each one a
// piece of structure or a part of a field, and the fields they make up.
// Field changes are applied to this layout; scans only keep its fields.
#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "VantorSyncManager/Value.h"
#include "client/stores/VdirItem.h"

namespace vtc::client {

struct ItemUnit {
  enum class Role {
    Property,  // one content line of a field
    Block,     // a nested component whole (a time zone, alarms): part of a field
    Begin,     // BEGIN of the item or of an event, to-do, journal entry
    End,       // its END
    Blank,     // an empty line, kept where it is
  };
  Role role;
  std::string_view raw;   // the exact bytes, line ends included
  std::string key;        // the field's key; empty for Begin, End and Blank
  std::string container;  // "" for the item's own level, else the component ("VEVENT/<uid>")
};

struct ItemLayout {
  std::vector<ItemUnit> units;
  Dictionary fields;  // key -> the field's lines, CRLF-ended and folded
};

// The layout of bytes; none when they are not a valid item of this kind,
// with *problem (when given) saying why in a few words.
std::optional<ItemLayout> readItemLayout(ItemKind kind, std::string_view bytes,
                                         std::string* problem = nullptr);

// Key prefixes of a calendar's own properties and of its time zones; the
// fields of an event, to-do or journal entry have "<kind>/<uid>/" or
// "<kind>/<uid>/<recurrence-id>/" before the property name.
constexpr char kCalendarPrefix[] = "VCALENDAR/";
constexpr char kTimeZonePrefix[] = "VTIMEZONE/";

}  // namespace vtc::client
