// The status as a person reads it, and as one JSON document for scripts.
#pragma once

#include <iosfwd>
#include <optional>
#include <string>

#include "VantorSyncManager/Value.h"
#include "client/run/StatusReport.h"

namespace vtc::client {

void printStatus(const StatusReport& status, std::ostream& out);
std::string statusAsJson(const StatusReport& status);

// A date in local time, "2026-11-22 22:14:03", or "never".
std::string localTime(const std::optional<Date>& date);

// How long before now a date was, in words: "just now", "1 minute ago",
// "2 hours ago", "3 days ago".
std::string timeAgo(Date then, Date now);

}  // namespace vtc::client
