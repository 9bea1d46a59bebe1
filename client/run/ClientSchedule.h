// The client's own schedule: a systemd user timer that starts
// `nubilosyncclient --sync --periodic` at the interval the user gave. An
// interval that divides an hour or a day evenly runs on the clock
// (OnCalendar=, with Persistent= so that a run missed while the computer
// slept or was off happens when it is back); any other runs that long after
// the last one (OnUnitActiveSec=) and once after login. The units are
// wanted by default.target, so that a computer without a desktop session
// syncs too.
#pragma once

#include <optional>
#include <string>

#include "VantorSyncManager/Value.h"
#include "client/run/Automation.h"
#include "client/run/SyncFailure.h"

namespace vtc::client {

inline constexpr const char* kScheduleUnit = "nubilosyncclient";

struct ScheduleUnitFiles {
  std::string service, timer;  // the units' text
};

// "every 30 minutes", "every 2 hours", "every day".
std::string cadenceOf(const ScheduleEvery& every);
// The interval in seconds.
int64_t secondsOf(const ScheduleEvery& every);
// The OnCalendar= expression of an interval that divides an hour or a day
// evenly; none for any other.
std::optional<std::string> calendarOf(const ScheduleEvery& every);
ScheduleUnitFiles scheduleUnits(const ScheduleEvery& every, const std::string& program);
// The next run after now: on the clock, or an interval after the last
// attempt (now when there was none).
Date nextRun(const ScheduleEvery& every, Date now, std::optional<Date> lastAttempt);

// Writes the units and asks the user manager to start the timer; returns
// whether it did (false: no user manager runs here).
bool installSchedule(const ScheduleEvery& every);
void removeSchedule();
// The interval of the installed schedule; none when it is off.
std::optional<ScheduleEvery> installedSchedule();

}  // namespace vtc::client
