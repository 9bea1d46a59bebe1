#include "client/run/Automation.h"

#include <ctime>
#include <regex>

#include "VantorSyncManager/NotifyHelper.h"
#include "VantorSyncManager/PublicNames.h"
#include "VantorSyncManager/VTCPrefsCenter.h"
#include "client/run/Account.h"
#include "client/run/ClientSchedule.h"
#include "client/run/Collections.h"
#include "client/run/SyncFailure.h"
#include "common/Clock.h"
#include "common/Format.h"
#include "platform/jobs/UnitFiles.h"
#include "platform/jobs/UserManager.h"
#include "platform/plist/PlistCodec.h"
#include "platform/prefs/PreferenceStore.h"
#include "platform/push/PushMessage.h"
#include "platform/push/PushService.h"
#include "platform/secrets/StoredAccount.h"
#include "prefs/AutoSyncJobs.h"

namespace vtc::client {

namespace {

void requirePushServer() {
  if (!push::configuredBroker())
    throw SyncFailure(FailureKind::Usage,
                      "No push server is set up; add one with `nubilosyncclient setup URL --user "
                      "NAME --push mqtt[s]://HOST[:PORT]`.");
}

bool pushOnFor(const std::optional<std::string>& member) {
  return member && NotifyHelper::isBeaconEnabledForAccount(*member) == 1;
}

}  // namespace

ScheduleEvery ScheduleEvery::parse(const std::string& text) {
  static const std::regex form(R"(^([1-9][0-9]{0,5})([smhd])$)");
  std::smatch m;
  if (!std::regex_match(text, m, form))
    throw SyncFailure(FailureKind::Usage, "\"" + text +
                                              "\" is not an interval; write a number and s, m, "
                                              "h or d, as in 30m, 1h or 1d.");
  const char unit = std::string(m[2])[0];
  return {std::stoi(m[1]), unit == 'm' ? 0 : unit == 'h' ? 1 : unit == 'd' ? 2 : 3};
}

AutomationState automationState() {
  VTCPrefsCenter& prefs = VTCPrefsCenter::defaultCenter();
  AutomationState state;
  if (const auto every = installedSchedule()) {
    state.scheduleOn = true;
    state.cadence = cadenceOf(*every);
    std::optional<Date> last;
    for (const Collection& c : configuredCollections())
      if (auto attempt = prefs.lastAttemptedSyncDateForDataclass(c.dataclass))
        last = last ? std::max(*last, *attempt) : *attempt;
    state.nextScheduledSync = nextRun(*every, currentClock().now(), last);
  }
  if (auto broker = push::configuredBroker()) state.pushServer = broker->url();
  state.pushOn = pushOnFor(storedMemberName());
  return state;
}

ScheduleOutcome turnScheduleOn(const std::optional<ScheduleEvery>& every) {
  VTCPrefsCenter& prefs = VTCPrefsCenter::defaultCenter();
  // The library's own periodic job would sync a second time: it stays off.
  if (prefs.autoSyncOn()) prefs.setAutoSyncOn(false);
  const ScheduleEvery interval = every ? *every : installedSchedule().value_or(ScheduleEvery{1, 1});
  const bool started = installSchedule(interval);
  return {cadenceOf(interval), started};
}

void turnScheduleOff() {
  VTCPrefsCenter& prefs = VTCPrefsCenter::defaultCenter();
  if (prefs.autoSyncOn()) prefs.setAutoSyncOn(false);
  removeSchedule();
}

std::string checkedPushServer(const std::string& url) {
  std::optional<push::BrokerAddress> broker = push::BrokerAddress::parse(url);
  if (!broker)
    throw SyncFailure(FailureKind::Usage, "\"" + url +
                                              "\" is not a push server address; write it as "
                                              "mqtt://host[:port] or mqtts://host[:port].");
  return broker->url();
}

void storePushServer(const std::string& url) {
  auto& store = prefs::PreferenceStore::shared();
  store.setValue(push::kPushServerKey, Value(checkedPushServer(url)), kVantorDefaultsKey,
                 prefs::Scope::AnyHost);
  store.synchronize(kVantorDefaultsKey, prefs::Scope::AnyHost);
}

void turnPushOn() {
  requirePushServer();
  const auto [member, password] = storedCredentials();
  // The same connection the listener will make: a wrong address or a
  // refused account is told now, not found later in a log.
  if (!push::createSession(member, password, nullptr, nullptr))
    throw SyncFailure(FailureKind::Unreachable,
                      "The push server at " + push::configuredBroker()->url() +
                          " cannot be reached or refused " + member +
                          "; check its address with `nubilosyncclient setup` and its accounts.");
  NotifyHelper& helper = NotifyHelper::notificationSessionForAccount(member, password);
  for (const Collection& c : configuredCollections())
    helper.enableDataclassForNotifications(c.dataclass);
  NotifyHelper::setBeaconEnabled(true, member);
}

void turnPushOff() {
  const auto [member, password] = storedCredentials();
  NotifyHelper& helper = NotifyHelper::notificationSessionForAccount(member, password);
  for (const Collection& c : configuredCollections())
    helper.disableDataclassForNotifications(c.dataclass);
  NotifyHelper::setBeaconEnabled(false, member);
}

void followAddedFolder(const std::string& dataclass) {
  if (!pushOnFor(storedMemberName())) return;
  const auto [member, password] = storedCredentials();
  NotifyHelper::notificationSessionForAccount(member, password)
      .enableDataclassForNotifications(dataclass);
}

void followRemovedFolder(const std::string& dataclass) {
  if (!pushOnFor(storedMemberName())) return;
  const auto [member, password] = storedCredentials();
  NotifyHelper::notificationSessionForAccount(member, password)
      .disableDataclassForNotifications(dataclass);
}

bool userManagerHas(const std::string& unit) {
  return jobs::systemctl({"is-enabled", "--quiet", unit}).status == 0;
}

void announceCommits(const std::string& member, const std::string& password,
                     const std::vector<std::string>& dataclasses) {
  if (dataclasses.empty() || !push::configuredBroker()) return;
  const Value payload =
      push::commitAnnouncement(VTCPrefsCenter::defaultCenter().clientGuid().value_or(""));
  NotifyHelper& helper = NotifyHelper::notificationSessionForAccount(member, password);
  for (const std::string& dataclass : dataclasses) helper.addDataclassToNotify(dataclass, payload);
  helper.sendNotifications();
}

}  // namespace vtc::client
