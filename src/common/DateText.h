// Dates read from text by a pattern, on the Gregorian calendar. A pattern is
// made of the fields yyyy (year), MM (month), dd (day), HH (hour, 00-23), mm
// (minute), ss (second), SSS (milliseconds) and ZZZ (a zone offset such as
// +0100 or -0800); every other character must appear as it stands. Fields
// have exactly the width of their letters and the whole text must match.
#pragma once

#include <optional>
#include <string_view>

#include "VantorSyncManager/Value.h"

namespace vtc::dates {

// The date the text names, or nothing when it does not match the pattern or
// names no real date.
std::optional<Date> parse(std::string_view text, std::string_view pattern);

}  // namespace vtc::dates
