// What the library remembers on this computer: the sync switch, the client's
// identity, each dataclass's sync dates, failure counts, change tags and
// download counters, sync modes, the queue of dataclasses for the next sync,
// the stored account, the client configuration, and automatic syncs (the
// periodic job and sync on change). Values live in the
// per-host scope of the "com.korvo.VantorSync" preference domain. No
// operation raises; absent values read as the stated defaults.
#pragma once

#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "VantorSyncManager/Export.h"
#include "VantorSyncManager/Value.h"

class VSM_EXPORT VTCPrefsCenter {
 public:
  // The process-wide instance, created on first use and never released.
  static VTCPrefsCenter& defaultCenter();
  // ~/.local/share/NubiloSyncClient (created on first use), or nothing.
  static std::optional<std::string> applicationSupportDirectory();

  // Sync results.
  void setSyncSuccessful(bool successful, const std::string& dataclass);
  void setLastAttemptedSyncDateForDataclass(const std::string& dataclass);
  std::optional<vtc::Date> lastAttemptedSyncDateForDataclass(const std::string& dataclass);
  std::optional<vtc::Date> lastSuccessfulSyncDateForDataclass(const std::string& dataclass);
  int64_t failedSyncCountForDataclass(const std::string& dataclass);
  void setFailedDataclassCounts(const vtc::Value& counts);
  vtc::Value getFailedDataclassCounts();
  void setLastSyncDate(std::optional<vtc::Date> date);
  std::optional<vtc::Date> lastSyncDate();
  void setLastSuccessfulSyncDate(std::optional<vtc::Date> date);
  std::optional<vtc::Date> lastSuccessfulSyncDate();

  // Inconsistency guards.
  void setFailedETag(const std::string& etag, const std::string& dataclass);
  std::optional<std::string> failedETagForDataclass(const std::string& dataclass);
  void setDownloadedAnchorClog(const vtc::Value& anchor, const std::string& dataclass);
  int64_t repeatedDownloadCountForDataclass(const std::string& dataclass);

  // Storage.
  void setStorageConsumed(const vtc::Value& bytes, const std::string& dataclass);
  vtc::Value storageConsumedForDataclass(const std::string& dataclass);

  // Modes (6 when none is stored).
  void setSyncMode(int32_t mode, const std::string& dataclass);
  int32_t syncModeForDataclass(const std::string& dataclass);
  int32_t synchronizedSyncModeForDataclass(const std::string& dataclass);

  // The queue of dataclasses for the next sync.
  bool queueDataclasses(const std::vector<std::string>& dataclasses);
  std::optional<std::vector<std::string>> getQueuedDataclasses(bool clear);

  // Identity and switches.
  void setClientGuid(const std::string& guid);
  std::optional<std::string> clientGuid();
  void setClientName(const std::string& name);
  std::optional<std::string> clientName();
  void setSyncTurnedOn(bool on);
  bool syncTurnedOn();
  std::optional<std::string> username();
  std::optional<std::string> password();
  void setConfigTTLDate(std::optional<vtc::Date> date);
  std::optional<vtc::Date> configTTLDate();
  std::string systemVersion();

  // Automatic sync. Periodic sync is on while its job description file
  // exists; the job runs the sync client on a calendar made from the stored
  // interval and unit (0 minutes, 1 hours, 2 days, other values seconds),
  // coarsely: more than a day runs weekly, more than an hour daily, more
  // than a minute hourly, else every minute. Job launcher failures are
  // logged, never raised.
  bool autoSyncOn();
  bool autoSyncOn(bool ignored);
  void setAutoSyncOn(bool on);
  int32_t autoSyncInterval();
  void setAutoSyncInterval(int32_t interval);
  int32_t autoSyncIntervalUnit();
  void setAutoSyncUnit(int32_t unit);
  // Sync on change: the sync engine starts this client after other clients
  // synced, and a job syncs the browser's bookmarks when they change.
  bool automaticallySyncOn();
  void setAutomaticallySyncOn(bool on);
  // Minutes: the larger of the configuration's default interval and its
  // minimum.
  int32_t automaticallySyncInterval();
  bool syncNotificationsGloballyEnabled();
  // Installs the bookmarks job unless its file exists (true then). False
  // when the browser's sync client is not found, the job folder cannot be
  // made, or something other than a file stands at the job file's path. A
  // refused submission is an Error line and still true, and so is a job
  // file that could not be written (the job is submitted all the same).
  bool checkBookmarksPlistAndCreateIfNecessary();

  // The client configuration, built once per process.
  const vtc::Dictionary& configuration();
  // Forgets it, so that the next use builds it again (tests only).
  void resetConfigurationForTesting();
  vtc::Dictionary defaultConfiguration();

  // Maintenance; the last three are kept for older callers.
  void resetPreferences();
  std::optional<vtc::Dictionary> allPrefs();
  vtc::Value objectForKey(const std::string& key);
  void setObject(const vtc::Value& value, const std::string& key);

  // Writes pending changes of the per-host scope to disk and re-reads it.
  void synchronize();

 private:
  VTCPrefsCenter();
  ~VTCPrefsCenter();
  vtc::Value get(const std::string& key);
  void set(const std::string& key, vtc::Value value);

  std::optional<vtc::Dictionary> _configuration;
  std::mutex configurationMutex_;
};

// The last sync date plus the periodic job's "StartInterval" (a job written
// by setAutoSyncOn has none), when that lies in the future; none when
// periodic sync is off.
VSM_EXPORT std::optional<vtc::Date> nextAutoSyncTriggerDate();
