// VTCPrefsCenter: per-dataclass sync results, change-tag and anchor guards,
// storage, and sync modes.
#include <exception>

#include "VantorSyncManager/PublicNames.h"
#include "VantorSyncManager/VTCPrefsCenter.h"
#include "common/Clock.h"
#include "common/Logging.h"
#include "platform/bus/DistributedNotifications.h"
#include "prefs/PrefsKeys.h"
#include "prefs/SyncEngineSettings.h"

namespace keys = vtc::prefkeys;
using keys::forDataclass;

namespace {

std::optional<vtc::Date> asDate(const vtc::Value& v) {
  return v.kind() == vtc::Value::Kind::Date ? std::optional<vtc::Date>(v.date()) : std::nullopt;
}

vtc::Value dateValue(std::optional<vtc::Date> d) {
  return d ? vtc::Value(*d) : vtc::Value();
}

}  // namespace

void VTCPrefsCenter::setSyncSuccessful(bool successful, const std::string& dataclass) {
  vtc::Date now = vtc::currentClock().now();
  set(forDataclass(keys::kLastAttemptedSync, dataclass), vtc::Value(now));
  if (successful) {
    set(forDataclass(keys::kLastSuccessSyncPrefix, dataclass), vtc::Value(now));
    for (const char* prefix :
         {keys::kFailedCount, keys::kETag, keys::kETagTTL, keys::kAnchorCount, keys::kAnchorClog})
      set(forDataclass(prefix, dataclass), vtc::Value());
  } else {
    vtc::Value count = get(forDataclass(keys::kFailedCount, dataclass));
    set(forDataclass(keys::kFailedCount, dataclass),
        vtc::Value(count.isNone() ? 1 : count.integer() + 1));
  }
  synchronize();
}

void VTCPrefsCenter::setLastAttemptedSyncDateForDataclass(const std::string& dataclass) {
  set(forDataclass(keys::kLastAttemptedSync, dataclass), vtc::Value(vtc::currentClock().now()));
  synchronize();
}

std::optional<vtc::Date> VTCPrefsCenter::lastAttemptedSyncDateForDataclass(
    const std::string& dataclass) {
  return asDate(get(forDataclass(keys::kLastAttemptedSync, dataclass)));
}

std::optional<vtc::Date> VTCPrefsCenter::lastSuccessfulSyncDateForDataclass(
    const std::string& dataclass) {
  return asDate(get(forDataclass(keys::kLastSuccessSyncPrefix, dataclass)));
}

int64_t VTCPrefsCenter::failedSyncCountForDataclass(const std::string& dataclass) {
  return get(forDataclass(keys::kFailedCount, dataclass)).integer();
}

void VTCPrefsCenter::setFailedDataclassCounts(const vtc::Value& counts) {
  set(keys::kFailedCount, counts);
}

vtc::Value VTCPrefsCenter::getFailedDataclassCounts() {
  return get(keys::kFailedCount);
}

void VTCPrefsCenter::setLastSyncDate(std::optional<vtc::Date> date) {
  set(keys::kLastSync, dateValue(date));
}

std::optional<vtc::Date> VTCPrefsCenter::lastSyncDate() {
  return asDate(get(keys::kLastSync));
}

void VTCPrefsCenter::setLastSuccessfulSyncDate(std::optional<vtc::Date> date) {
  VTC_LOG_INFO("Setting last successful sync date to %@", dateValue(date));
  set(keys::kLastSuccessSync, dateValue(date));
  synchronize();
  VTC_LOG_INFO("Posting last sync date changed notification");
  vtc::bus::postDistributedNotification(kLastSyncDateChangedNotification);
}

std::optional<vtc::Date> VTCPrefsCenter::lastSuccessfulSyncDate() {
  synchronize();
  std::optional<vtc::Date> date = asDate(get(keys::kLastSuccessSync));
  if (!date) {
    // Once only: the date may still sit in the sync engine's record.
    try {
      date = vtc::engineLastSuccessfulSyncDate();
      if (date) {
        VTC_LOG_INFO("Previous Last sync date %@ found, migrating...", vtc::Value(*date));
        setLastSuccessfulSyncDate(date);
        vtc::removeEngineLastSuccessfulSyncDate();
      } else {
        VTC_LOG_INFO("No Previous Last sync date found");
      }
    } catch (const std::exception&) {
      // The migration is best effort: without it the date is simply unknown.
    }
  }
  VTC_LOG_INFO("Returning last successful sync date %@", dateValue(date));
  return date;
}

void VTCPrefsCenter::setFailedETag(const std::string& etag, const std::string& dataclass) {
  int64_t ttl = configuration().get("inconsistency_ttl").integer();
  vtc::Date until = vtc::currentClock().now() + std::chrono::seconds(ttl);
  VTC_LOG_INFO("Storing failed etag %@ for dataclass %@ with TTL date of %@", etag, dataclass,
               vtc::Value(until));
  set(forDataclass(keys::kETag, dataclass), vtc::Value(etag));
  set(forDataclass(keys::kETagTTL, dataclass), vtc::Value(until));
  synchronize();
}

std::optional<std::string> VTCPrefsCenter::failedETagForDataclass(const std::string& dataclass) {
  std::optional<vtc::Date> ttl = asDate(get(forDataclass(keys::kETagTTL, dataclass)));
  // An expired tag is not believed, but stays stored until the next success.
  if (ttl && *ttl < vtc::currentClock().now()) return std::nullopt;
  vtc::Value tag = get(forDataclass(keys::kETag, dataclass));
  return tag.isString() ? std::optional<std::string>(tag.string()) : std::nullopt;
}

void VTCPrefsCenter::setDownloadedAnchorClog(const vtc::Value& anchor,
                                             const std::string& dataclass) {
  vtc::Value stored = get(forDataclass(keys::kAnchorClog, dataclass));
  int64_t count = repeatedDownloadCountForDataclass(dataclass);
  if (!stored.isNone() && stored.integer() == anchor.integer()) {
    count += 1;
  } else {
    set(forDataclass(keys::kAnchorClog, dataclass), anchor);
    count = 0;
  }
  set(forDataclass(keys::kAnchorCount, dataclass), vtc::Value(count));
  synchronize();
}

int64_t VTCPrefsCenter::repeatedDownloadCountForDataclass(const std::string& dataclass) {
  return get(forDataclass(keys::kAnchorCount, dataclass)).integer();
}

void VTCPrefsCenter::setStorageConsumed(const vtc::Value& bytes, const std::string& dataclass) {
  VTC_LOG_INFO("Recording %@ bytes consumed for dataclass %@", bytes, dataclass);
  set(forDataclass(keys::kStorageConsumed, dataclass), bytes);
}

vtc::Value VTCPrefsCenter::storageConsumedForDataclass(const std::string& dataclass) {
  return get(forDataclass(keys::kStorageConsumed, dataclass));
}

void VTCPrefsCenter::setSyncMode(int32_t mode, const std::string& dataclass) {
  vtc::Value modes = get(keys::kDataclassModes);
  if (modes.isDictionary()) {
    const vtc::Value* current = modes.dictionary().find(dataclass);
    if (current && current->integer() == mode) return;  // unchanged: nothing is written
  } else {
    modes = vtc::Value(vtc::Dictionary{});
  }
  modes.mutableDictionary().set(dataclass, vtc::Value(mode));
  set(keys::kDataclassModes, modes);
  synchronize();
}

int32_t VTCPrefsCenter::syncModeForDataclass(const std::string& dataclass) {
  vtc::Value modes = get(keys::kDataclassModes);
  const vtc::Value* mode = modes.dictionary().find(dataclass);
  return mode ? static_cast<int32_t>(mode->integer()) : keys::kDefaultSyncMode;
}

int32_t VTCPrefsCenter::synchronizedSyncModeForDataclass(const std::string& dataclass) {
  synchronize();
  return syncModeForDataclass(dataclass);
}
