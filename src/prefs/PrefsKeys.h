// Keys and folders of the per-host preference scope.
#pragma once

#include <string>

namespace vtc::prefkeys {

inline constexpr const char* kLastSync = "lastsync";
inline constexpr const char* kLastSuccessSync = "lastSuccessSync";
inline constexpr const char* kDataclassModes = "DataclassModes";
inline constexpr const char* kShouldSyncWithServer = "ShouldSyncWithServer";
inline constexpr const char* kClientGuid = "ClientGuid";
inline constexpr const char* kClientName = "ClientName";
inline constexpr const char* kConfigTTLDate = "ConfigTTLDate";
inline constexpr const char* kLoggingLevel = "LoggingLevel";
inline constexpr const char* kAutoSyncOn = "AutoSyncOn";
inline constexpr const char* kAutoSyncWithNotifications = "AutoSyncWithNotifications";
inline constexpr const char* kAutoSyncInterval = "AutoSyncInterval";
inline constexpr const char* kAutoSyncIntervalUnit = "AutoSyncIntervalUnit";

// Per-dataclass keys are a prefix followed by the dataclass name. The bare
// "FailedCount." is the key of the whole failed-count collection.
inline constexpr const char* kLastAttemptedSync = "lastAttemptedSync.";
inline constexpr const char* kLastSuccessSyncPrefix = "lastSuccessSync.";
inline constexpr const char* kFailedCount = "FailedCount.";
inline constexpr const char* kETag = "etag.";
inline constexpr const char* kETagTTL = "etagTTL.";
inline constexpr const char* kAnchorCount = "anchorCount.";
inline constexpr const char* kAnchorClog = "anchorClog.";
inline constexpr const char* kStorageConsumed = "StorageConsumed.";

inline constexpr int32_t kDefaultSyncMode = 6;
inline constexpr const char* kQueueFolder = "com.korvo.nubilo.queueddataclasses";

inline std::string forDataclass(const char* prefix, const std::string& dataclass) {
  return prefix + dataclass;
}

}  // namespace vtc::prefkeys
