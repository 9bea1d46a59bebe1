// VTCPrefsCenter: periodic sync through the per-user job launcher, sync on
// change through the sync engine and the bookmarks job.
#include <sys/stat.h>
#include <unistd.h>

#include <ctime>
#include <exception>

#include "VantorSyncManager/PublicNames.h"
#include "VantorSyncManager/VTCPrefsCenter.h"
#include "common/Clock.h"
#include "common/Logging.h"
#include "platform/fs/LocalPaths.h"
#include "platform/jobs/Crontab.h"
#include "platform/jobs/JobLauncher.h"
#include "platform/plist/PlistCodec.h"
#include "prefs/AutoSyncJobs.h"
#include "prefs/PrefsKeys.h"
#include "prefs/SyncEngineSettings.h"

namespace keys = vtc::prefkeys;
namespace autosync = vtc::autosync;

namespace {

bool isFile(const std::string& path) {
  struct stat st {};
  return ::stat(path.c_str(), &st) == 0 && !S_ISDIR(st.st_mode);
}

void removeJob(const char* label) {
  std::string error;
  if (!vtc::jobs::jobRemove(label, true, error))
    VTC_LOG_ERROR("Failed to remove job from taskd %@", error);
}

void submitJob(const vtc::Dictionary& description) {
  std::string error;
  if (!vtc::jobs::jobSubmit(description, error))
    VTC_LOG_ERROR("Failed with %@ to submit job to taskd %@", error, description);
}

size_t calendarEntries(const vtc::Value& job) {
  return job.dictionary().get("StartCalendarInterval").dictionary().size();
}

}  // namespace

bool VTCPrefsCenter::autoSyncOn() {
  return ::access(autosync::periodicJobFile().c_str(), F_OK) == 0;
}

bool VTCPrefsCenter::autoSyncOn(bool) {
  return autoSyncOn();
}

void VTCPrefsCenter::setAutoSyncOn(bool on) {
  const bool jobExists = autoSyncOn();
  if (get(keys::kAutoSyncOn).boolean() && !jobExists) {
    // Periodic sync was on before the job files: it was the older
    // scheduler's, whose entry goes now.
    std::string error;
    if (!vtc::jobs::removeScheduledAction(kVantorDefaultsKey, autosync::kOlderSchedulerAction,
                                          error))
      VTC_LOG_WARNING("Could not remove the older scheduler's %@ action: %@",
                      autosync::kOlderSchedulerAction, error);
  }
  const std::string file = autosync::periodicJobFile();
  if (jobExists && !on) {
    removeJob(autosync::kPeriodicLabel);
    ::unlink(file.c_str());  // a failure leaves the job file: periodic sync stays on
  }
  if (on && autoSyncInterval() > 0) {
    const std::time_t now = std::chrono::system_clock::to_time_t(vtc::currentClock().now());
    std::tm local{};
    localtime_r(&now, &local);
    const vtc::Dictionary calendar = autosync::calendarForPeriod(
        autosync::periodSeconds(autoSyncInterval(), autoSyncIntervalUnit()), local);
    const vtc::Dictionary description = autosync::periodicJobDescription(calendar);
    vtc::paths::makeDirectories(autosync::launchAgentsFolder());
    if (jobExists) {
      // Only a change of cadence rewrites the job: the same number of
      // calendar entries keeps the existing one, at its old hour and minute.
      const vtc::Value existing = vtc::plist::readFile(file).value_or(vtc::Value());
      if (calendarEntries(existing) != calendar.size()) {
        vtc::plist::writeFileAtomically(file, vtc::Value(description));
        removeJob(autosync::kPeriodicLabel);
        submitJob(description);
      }
    } else {
      vtc::plist::writeFileAtomically(file, vtc::Value(description));
      submitJob(description);
    }
  }
  set(keys::kAutoSyncOn, vtc::Value(on));
  synchronize();
}

int32_t VTCPrefsCenter::autoSyncInterval() {
  synchronize();
  return static_cast<int32_t>(get(keys::kAutoSyncInterval).integer());
}

void VTCPrefsCenter::setAutoSyncInterval(int32_t interval) {
  set(keys::kAutoSyncInterval, vtc::Value(interval));
  synchronize();
}

int32_t VTCPrefsCenter::autoSyncIntervalUnit() {
  return static_cast<int32_t>(get(keys::kAutoSyncIntervalUnit).integer());
}

void VTCPrefsCenter::setAutoSyncUnit(int32_t unit) {
  set(keys::kAutoSyncIntervalUnit, vtc::Value(unit));
}

bool VTCPrefsCenter::automaticallySyncOn() {
  synchronize();
  return get(keys::kAutoSyncWithNotifications).boolean();
}

void VTCPrefsCenter::setAutomaticallySyncOn(bool on) {
  vtc::setSyncsAfterOtherClients(on);
  if (on) checkBookmarksPlistAndCreateIfNecessary();
  // Turning it off leaves the bookmarks job in place.
  set(keys::kAutoSyncWithNotifications, vtc::Value(on));
  synchronize();
}

int32_t VTCPrefsCenter::automaticallySyncInterval() {
  const vtc::Dictionary& c = configuration();
  const int64_t fromDefault = c.get("DefaultDataclassSyncIntervalSeconds").integer() / 60;
  return static_cast<int32_t>(
      std::max(fromDefault, c.get("MinAutomaticallySyncInterval").integer()));
}

bool VTCPrefsCenter::syncNotificationsGloballyEnabled() {
  return configuration().get("enable_notify_support").boolean();
}

bool VTCPrefsCenter::checkBookmarksPlistAndCreateIfNecessary() {
  const std::string file = autosync::bookmarksJobFile();
  if (isFile(file)) return true;
  std::optional<std::string> syncClient = autosync::bookmarksSyncClient();
  if (!syncClient) return false;
  const vtc::Dictionary description = autosync::bookmarksJobDescription(*syncClient);
  const std::string folder = autosync::launchAgentsFolder();
  if (!vtc::paths::makeDirectories(folder)) return false;
  if (::access(file.c_str(), F_OK) == 0) return false;  // a folder stands in the way
  try {
    vtc::plist::writeFileAtomically(file, vtc::Value(description));
    submitJob(description);
  } catch (const std::exception& e) {
    VTC_LOG_ERROR("Failed with %@ to submit job to taskd %@", e.what(), description);
    return false;
  }
  return true;
}

std::optional<vtc::Date> nextAutoSyncTriggerDate() {
  VTCPrefsCenter& center = VTCPrefsCenter::defaultCenter();
  if (!center.autoSyncOn()) return std::nullopt;
  const vtc::Value job = vtc::plist::readFile(autosync::periodicJobFile()).value_or(vtc::Value());
  // The job written by setAutoSyncOn runs on a calendar and has no
  // "StartInterval": the answer is then the last sync date, which has passed.
  const int64_t interval = job.dictionary().get("StartInterval").integer();
  std::optional<vtc::Date> last = center.lastSyncDate();
  if (!last) return std::nullopt;
  const vtc::Date candidate = *last + std::chrono::seconds(interval);
  if (candidate > vtc::currentClock().now()) return candidate;
  return std::nullopt;
}
