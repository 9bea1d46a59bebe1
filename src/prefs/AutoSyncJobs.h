// The two jobs of automatic sync: the periodic sync client job and the
// browser's bookmarks job, their description files under
// ~/Library/LaunchAgents (the source of truth for whether they exist), and
// the calendar the periodic job runs on.
#pragma once

#include <ctime>
#include <optional>
#include <string>

#include "VantorSyncManager/Value.h"

namespace vtc::autosync {

inline constexpr const char* kPeriodicLabel = "com.korvo.NubiloSyncClientAgent";
inline constexpr const char* kBookmarksLabel = "com.korvo.Voyager";
inline constexpr const char* kOlderSchedulerAction = "AutoSync";

std::string launchAgentsFolder();  // ~/Library/LaunchAgents
std::string periodicJobFile();     // .../com.korvo.NubiloSyncClientAgent.plist
std::string bookmarksJobFile();    // .../com.korvo.VoyagerBookmarksSyncer.plist

// Seconds of an interval in a unit: 0 minutes, 1 hours, 2 days, other
// values seconds.
int64_t periodSeconds(int64_t interval, int64_t unit);

// The "StartCalendarInterval" of a period, taken from the local time `now`:
// "Weekday" from 86,401 seconds, "Hour" from 3,601, "Minute" from 61.
Dictionary calendarForPeriod(int64_t seconds, const std::tm& now);

Dictionary periodicJobDescription(const Dictionary& calendar);

// The browser's sync client executable, or none when the browser is not
// installed.
std::optional<std::string> bookmarksSyncClient();
Dictionary bookmarksJobDescription(const std::string& syncClient);

}  // namespace vtc::autosync
