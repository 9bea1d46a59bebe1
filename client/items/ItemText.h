// An item file (a vCard, or an iCalendar object) cut into units: the
// pieces that two computers can change independently, each with its exact
// bytes. Laid end to end, the units give back the file byte for byte.
//
// vCard: the frame (BEGIN with anything before it, END with anything
// after it) and one unit per property line; a vCard 2.1 AGENT with a card
// inside is one unit. iCalendar: the calendar's frame and own properties,
// each time zone whole, and per event, to-do or journal entry (a
// "component", named by UID and RECURRENCE-ID) its frame, one unit per
// property and one per nested component (an alarm). Blank lines belong to
// the unit after them.
#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "client/stores/VdirItem.h"

namespace vtc::client {

struct ItemUnit {
  enum class Role {
    Frame,     // "(begin)" or "(end)" of the item or of a component
    Property,  // one content line
    Block,     // a nested component whole: a time zone, an alarm, an agent's card
  };
  Role role;
  std::string_view raw;  // the exact bytes, line ends included
  // "" at the item's own level, else the component:
  // "<kind>/<recurrence-id>/<uid>" ("VEVENT//<uid>" for a series or a single
  // event, "VEVENT/20250311T090000Z/<uid>" for one occurrence); one without
  // UID has "#<n>" for its UID.
  std::string scope;
  // Frame: "(begin)" or "(end)". Property: the upper-case name with its
  // group ("ITEM1.TEL"). Block: the component's name ("VALARM"), or
  // "VTIMEZONE#<tzid>" for a time zone.
  std::string name;
};

struct ItemText {
  std::vector<ItemUnit> units;
  // The UID that names the item: the vCard's, or the first component's;
  // empty when there is none.
  std::string uid;
};

// The units of bytes; none when they are not an item of this kind, with
// *problem (when given) saying why in a few words ("line 3 is not a
// content line").
std::optional<ItemText> readItemText(ItemKind kind, std::string_view bytes,
                                     std::string* problem = nullptr);

// The frame unit names.
inline constexpr char kBegin[] = "(begin)";
inline constexpr char kEnd[] = "(end)";

}  // namespace vtc::client
