#include "VantorSyncManager/NotifyHelper.h"

#include <mutex>

#include "VantorSyncManager/VTCPrefsCenter.h"
#include "common/Logging.h"
#include "common/SecretMemory.h"
#include "platform/bundle/BundleResources.h"
#include "platform/push/PushService.h"
#include "platform/secrets/StoredAccount.h"

namespace {

constexpr const char* kSharedClientID = "com.korvo.NubiloSync";
constexpr const char* kOrganisation = "korvo";
constexpr const char* kService = "nubilo";
constexpr const char* kSubService = "syncdav";

std::string launchableTool() {
  return vtc::bundle::pathForTool("nubilosyncclient").value_or("nubilosyncclient");
}

// Sessions are made without a context, so nothing reaches the helper's
// hooks: pushes are acted on by the launched sync client, not here.
void beaconCallback(int kind, vtc::push::Session*, void* context, const vtc::Value& value) {
  auto* helper = static_cast<NotifyHelper*>(context);
  if (!helper) return;
  if (kind == vtc::push::kSessionStatusEvent)
    helper->sessionStatusChanged(static_cast<int32_t>(value.integer()));
  else if (kind == vtc::push::kMessageEvent && !value.isNone())
    helper->messageReceived(value);
}

std::mutex sharedLock;
NotifyHelper* shared = nullptr;  // kept for the life of the process

}  // namespace

NotifyHelper& NotifyHelper::notificationSessionForAccount(const std::string& account,
                                                          const std::string& password) {
  std::lock_guard<std::mutex> guard(sharedLock);
  if (!shared) {
    shared = new NotifyHelper(kSharedClientID);
    shared->_setAccount(account);
    shared->_setPassword(password);
    shared->_createSession();
  }
  return *shared;
}

void NotifyHelper::resetSharedHelperForTesting() {
  std::lock_guard<std::mutex> guard(sharedLock);
  delete shared;
  shared = nullptr;
}

NotifyHelper::NotifyHelper(std::string clientID) : _clientID(std::move(clientID)) {}

NotifyHelper::~NotifyHelper() {
  _destroySession();
  _notificationsToSend.reset();
  vtc::wipe(_password);
}

void NotifyHelper::_setAccount(const std::string& account) {
  _account = account;
}

void NotifyHelper::_setPassword(const std::string& password) {
  if (!password.empty() && !_passwordHold) _passwordHold = std::make_unique<vtc::SecretHold>();
  vtc::wipe(_password);
  _password = password;
}

std::string NotifyHelper::topicAccount() const {
  // A helper made without an account registers for the stored one.
  return _account.empty() ? vtc::storedMemberName().value_or("") : _account;
}

void NotifyHelper::_createSession() {
  _beaconSession = vtc::push::createSession(_account, _password, &beaconCallback, nullptr);
  if (!_beaconSession)
    VTC_LOG_WARNING(
        "Could not schedule the Beacon Notification session - invalid session returned");
}

void NotifyHelper::_destroySession() {
  _beaconSession.reset();
}

void NotifyHelper::addDataclassToNotify(const std::string& dataclass, const vtc::Value& payload) {
  if (!_notificationsToSend) _notificationsToSend.emplace();
  _notificationsToSend->set(dataclass, payload);
}

void NotifyHelper::sendNotifications() {
  if (_notificationsToSend) {
    for (const auto& [dataclass, payload] : *_notificationsToSend) {
      std::optional<vtc::Dictionary> topic;
      // A dataclass whose topic cannot be made has nobody listening to it.
      if (vtc::push::createTopic(topicAccount(), kOrganisation, kService, kSubService, dataclass,
                                 topic) != 0 ||
          !topic)
        continue;
      VTC_LOG_INFO("Publishing to topic = %@", topic->get(vtc::push::kTopicKey));
      vtc::push::publish(_beaconSession.get(), *topic, payload);  // logs its own failure
    }
  }
  _notificationsToSend.reset();
}

void NotifyHelper::enableDataclassForNotifications(const std::string& dataclass) {
  std::optional<vtc::Dictionary> topic;
  if (vtc::push::createTopic(topicAccount(), kOrganisation, kService, kSubService, dataclass,
                             topic) == 0 &&
      topic) {
    const int32_t status = vtc::push::enableLaunchable(launchableTool(), *topic,
                                                       {"--sync", "--dataclasses", dataclass});
    if (status != 0)
      VTC_LOG_WARNING(
          "Cannot enable notification launch for dataclass %@ - error code %d returned.", dataclass,
          status);
  }
  VTC_LOG_INFO("%@ enabled for notifications, adding to dataclass queue", dataclass);
  VTCPrefsCenter::defaultCenter().queueDataclasses({dataclass});
}

void NotifyHelper::disableDataclassForNotifications(const std::string& dataclass) {
  std::optional<vtc::Dictionary> topic;
  if (vtc::push::createTopic(topicAccount(), kOrganisation, kService, kSubService, dataclass,
                             topic) != 0)
    return;
  if (topic) VTC_LOG_INFO("Removing subscription for topic = %@", topic->get(vtc::push::kTopicKey));
  const int32_t status = vtc::push::disableLaunchable(launchableTool(), topic);
  if (status != 0)
    VTC_LOG_WARNING("Cannot disable notification launch for dataclass %@ - error code %d returned.",
                    dataclass, status);
}

void NotifyHelper::setBeaconEnabled(bool enabled, const std::string& account) {
  const int32_t state = isBeaconEnabledForAccount(account);
  if (state == -1) return;
  if (!enabled)
    vtc::push::removeOnLoadSession(account);
  else if (state == 2)
    vtc::push::addOnLoadSession(account, "com.korvo.vantorPrefs", "${account}", "Kitbag");
}

int32_t NotifyHelper::isBeaconEnabledForAccount(const std::string& account) {
  int32_t state = -1;
  vtc::push::hasOnLoadSession(account, state);
  return state;
}

void NotifyHelper::messageReceived(const vtc::Value&) {}

void NotifyHelper::sessionStatusChanged(int32_t) {}
