// The conflicts a computer keeps, told to the other computers of the account
// through its client record on the share: each computer lists what the
// others kept, by the item's name with both values, so that a conflict is
// seen everywhere while its losing value stays where it was kept.
#pragma once

#include <string>
#include <vector>

#include "client/run/ConflictStore.h"

namespace vtc::client {

// The client record's property that holds them.
inline constexpr const char* kSharedConflictsKey = "conflicts";

// What another computer kept, as its record tells it.
struct SharedConflict {
  std::string computer;  // where it is kept
  std::string id, dataclass, name, file, field, kept, lost, keptComputer, lostComputer, date;
};

// The text of the record's property: the newest conflicts first, at most
// a few dozen, each value cut to a line's length.
std::string sharedConflictsText(const std::vector<KeptConflict>& conflicts);

// Reads the property of computer's record; text that is too long or not
// the property's form gives nothing.
std::vector<SharedConflict> readSharedConflicts(const std::string& computer,
                                                const std::string& text);

// A conflict's value on one line: folding undone, line ends shown as " | ".
std::string conflictValueLine(const Value& value);

// What a conflict is about: a property, an occurrence, or the item.
std::string conflictSubject(const std::string& field);

}  // namespace vtc::client
