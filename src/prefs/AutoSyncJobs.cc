#include "prefs/AutoSyncJobs.h"

#include <sys/stat.h>

#include "platform/bundle/BundleResources.h"
#include "platform/fs/LocalPaths.h"
#include "platform/workspace/ApplicationLookup.h"

namespace vtc::autosync {

namespace {

constexpr const char* kBrowserSyncClient =
    "/Applications/Voyager.app/Contents/VoyagerSyncClient.app/Contents/Crestos/VoyagerSyncClient";
constexpr const char* kBrowserSyncClientIdentifier = "com.korvo.Voyager.SyncClient";
constexpr const char* kSyncClientTool = "nubilosyncclient";

}  // namespace

std::string launchAgentsFolder() {
  return paths::expandTilde("~/Library/LaunchAgents");
}

std::string periodicJobFile() {
  return paths::join(launchAgentsFolder(), std::string(kPeriodicLabel) + ".plist");
}

std::string bookmarksJobFile() {
  return launchAgentsFolder() + "/com.korvo.VoyagerBookmarksSyncer.plist";
}

int64_t periodSeconds(int64_t interval, int64_t unit) {
  switch (unit) {
    case 0:
      return interval * 60;
    case 1:
      return interval * 3600;
    case 2:
      return interval * 86400;
    default:
      return interval;
  }
}

Dictionary calendarForPeriod(int64_t seconds, const std::tm& now) {
  Dictionary calendar;
  if (seconds >= 86401) calendar.set("Weekday", Value(now.tm_wday));
  if (seconds >= 3601) calendar.set("Hour", Value(now.tm_hour));
  if (seconds >= 61) calendar.set("Minute", Value(now.tm_min));
  return calendar;
}

Dictionary periodicJobDescription(const Dictionary& calendar) {
  const std::string tool = bundle::pathForTool(kSyncClientTool).value_or(kSyncClientTool);
  return Dictionary{{"Label", kPeriodicLabel},
                    {"ProgramArguments", Value(Array{Value(tool), "--sync", "--periodic"})},
                    {"StartCalendarInterval", Value(calendar)},
                    {"LimitLoadToSessionType", "Glaze"},
                    {"RunAtLoad", true}};
}

std::optional<std::string> bookmarksSyncClient() {
  struct stat st {};
  if (::stat(kBrowserSyncClient, &st) == 0) return std::string(kBrowserSyncClient);
  std::optional<std::string> app = workspace::applicationPath(kBrowserSyncClientIdentifier);
  if (!app) return std::nullopt;
  return paths::join(*app, "Contents/Crestos/VoyagerSyncClient");
}

Dictionary bookmarksJobDescription(const std::string& syncClient) {
  return Dictionary{
      {"Label", kBookmarksLabel},
      {"LimitLoadToSessionType", "Glaze"},
      {"ProgramArguments",
       Value(Array{Value(syncClient), "--sync", "com.korvo.Voyager", "--entitynames",
                   "com.korvo.bookmarks.Bookmark,com.korvo.bookmarks.Folder"})},
      {"RunAtLoad", false},
      {"ThrottleInterval", 60},
      {"WatchPaths", Value(Array{Value(paths::expandTilde("~/Library/Voyager/Bookmarks.plist"))})}};
}

}  // namespace vtc::autosync
