// VTCPrefsCenter: the shared instance, identity, switches, the stored
// account and maintenance.
#include "VantorSyncManager/VTCPrefsCenter.h"

#include <mutex>

#include "VantorSyncManager/PublicNames.h"
#include "common/Logging.h"
#include "platform/fs/LocalPaths.h"
#include "platform/os/SystemVersion.h"
#include "platform/prefs/PreferenceStore.h"
#include "platform/secrets/StoredAccount.h"
#include "prefs/PrefsKeys.h"
#include "prefs/SyncEngineSettings.h"

using vtc::prefs::PreferenceStore;
using vtc::prefs::Scope;
namespace keys = vtc::prefkeys;

VTCPrefsCenter& VTCPrefsCenter::defaultCenter() {
  static std::mutex classLock;
  static VTCPrefsCenter* center = nullptr;
  std::lock_guard<std::mutex> lock(classLock);
  if (!center) center = new VTCPrefsCenter();  // lives as long as the process
  return *center;
}

VTCPrefsCenter::VTCPrefsCenter() {
  // Per-host preferences describe this computer only. Linux has no
  // backup-exclusion attribute to set on the per-host file, so there is
  // nothing to do for it here.
}

VTCPrefsCenter::~VTCPrefsCenter() {
  synchronize();
}

std::optional<std::string> VTCPrefsCenter::applicationSupportDirectory() {
  return vtc::paths::supportFolder();
}

vtc::Value VTCPrefsCenter::get(const std::string& key) {
  return PreferenceStore::shared().copyValue(key, kVantorDefaultsKey, Scope::CurrentHost);
}

void VTCPrefsCenter::set(const std::string& key, vtc::Value value) {
  PreferenceStore::shared().setValue(key, std::move(value), kVantorDefaultsKey, Scope::CurrentHost);
}

void VTCPrefsCenter::synchronize() {
  PreferenceStore::shared().synchronize(kVantorDefaultsKey, Scope::CurrentHost);
}

void VTCPrefsCenter::setClientGuid(const std::string& guid) {
  set(keys::kClientGuid, vtc::Value(guid));
  synchronize();
}

std::optional<std::string> VTCPrefsCenter::clientGuid() {
  vtc::Value v = get(keys::kClientGuid);
  return v.isString() ? std::optional<std::string>(v.string()) : std::nullopt;
}

void VTCPrefsCenter::setClientName(const std::string& name) {
  set(keys::kClientName, vtc::Value(vtc::strippedClientName(name)));
  synchronize();
}

std::optional<std::string> VTCPrefsCenter::clientName() {
  vtc::Value v = get(keys::kClientName);
  return v.isString() ? std::optional<std::string>(v.string()) : std::nullopt;
}

void VTCPrefsCenter::setSyncTurnedOn(bool on) {
  set(keys::kShouldSyncWithServer, vtc::Value(on));
  synchronize();
}

bool VTCPrefsCenter::syncTurnedOn() {
  vtc::Value v = get(keys::kShouldSyncWithServer);
  if (v.isNone()) return false;
  if (v.isString()) return v.string() == "YES" || v.integer() == 1;
  return v.boolean();
}

std::optional<std::string> VTCPrefsCenter::username() {
  return vtc::storedMemberName();
}

std::optional<std::string> VTCPrefsCenter::password() {
  std::optional<std::string> name = username();
  if (!name) return std::nullopt;
  return vtc::storedPassword(*name);
}

void VTCPrefsCenter::setConfigTTLDate(std::optional<vtc::Date> date) {
  set(keys::kConfigTTLDate, date ? vtc::Value(*date) : vtc::Value());
}

std::optional<vtc::Date> VTCPrefsCenter::configTTLDate() {
  vtc::Value v = get(keys::kConfigTTLDate);
  return v.kind() == vtc::Value::Kind::Date ? std::optional<vtc::Date>(v.date()) : std::nullopt;
}

void VTCPrefsCenter::resetPreferences() {
  auto& store = PreferenceStore::shared();
  std::vector<std::string> all = store.copyKeyList(kVantorDefaultsKey, Scope::CurrentHost);
  if (all.empty()) return;
  // A reset never changes the log level.
  vtc::Value level = get(keys::kLoggingLevel);
  store.setMultiple({}, all, kVantorDefaultsKey, Scope::CurrentHost);
  set(keys::kLoggingLevel, level);
  synchronize();
}

std::optional<vtc::Dictionary> VTCPrefsCenter::allPrefs() {
  VTC_LOG_WARNING(
      "VTCPrefCenter allPrefs code is deprecated, please switch to using specific VTCPrefCenter "
      "calls to access prefs");
  vtc::Dictionary all =
      PreferenceStore::shared().copyMultiple({}, kVantorDefaultsKey, Scope::CurrentHost);
  if (all.empty()) return std::nullopt;
  return all;
}

vtc::Value VTCPrefsCenter::objectForKey(const std::string& key) {
  VTC_LOG_WARNING(
      "VTCPrefCenter objectForKey code is deprecated, please switch to using specific "
      "VTCPrefCenter calls to access prefs for key %@",
      key);
  if (key == "Password") {
    std::optional<std::string> p = password();
    return p ? vtc::Value(*p) : vtc::Value();
  }
  return get(key);
}

void VTCPrefsCenter::setObject(const vtc::Value& value, const std::string& key) {
  VTC_LOG_WARNING(
      "VTCPrefCenter setObject: forKey: code is deprecated, please switch to using specific "
      "VTCPrefCenter calls to access prefs for key %@",
      key);
  if (key == "AutoSyncWithNotifications") vtc::setSyncsAfterOtherClients(value.boolean());
  set(key, value);
  synchronize();
}

std::string VTCPrefsCenter::systemVersion() {
  return vtc::format("%@ (%@)", vtc::os::productVersion(), vtc::os::buildVersion());
}
