// NotifyHelper: publishes the queued dataclasses' push notifications so that
// the account's other computers sync, registers the sync client to be
// launched ("--sync" "--dataclasses" NAME) when a notification arrives on a
// dataclass's topic, and switches the account's login session on or off.
// Push failures are logged or skipped, never raised. One thread uses a
// helper at a time.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "VantorSyncManager/Export.h"
#include "VantorSyncManager/Value.h"

namespace vtc {
class SecretHold;
namespace push {
class Session;
}
}  // namespace vtc

class VSM_EXPORT NotifyHelper {
 public:
  // The process's shared helper, made on the first call with the client
  // identifier "com.korvo.NubiloSync", the account, its password and an open
  // session; later calls return it unchanged whatever they are given.
  static NotifyHelper& notificationSessionForAccount(const std::string& account,
                                                     const std::string& password);
  // A helper with no session, for registrations: its topics are those of
  // the account stored in the preferences.
  explicit NotifyHelper(std::string clientID);
  virtual ~NotifyHelper();
  NotifyHelper(const NotifyHelper&) = delete;
  NotifyHelper& operator=(const NotifyHelper&) = delete;

  // Queues the payload for the dataclass, replacing one queued before.
  void addDataclassToNotify(const std::string& dataclass, const vtc::Value& payload);
  // Publishes every queued payload on its dataclass's topic, then empties
  // the queue.
  void sendNotifications();
  // Registers the launch of the sync client for the dataclass's topic and
  // queues the dataclass for the next sync (also when registering fails).
  void enableDataclassForNotifications(const std::string& dataclass);
  void disableDataclassForNotifications(const std::string& dataclass);

  // Adds or removes the account's session that opens at login; nothing
  // happens while its state cannot be determined, and an existing one is
  // never added twice.
  static void setBeaconEnabled(bool enabled, const std::string& account);
  // -1 undetermined, 2 none at login, any other value one at login.
  static int32_t isBeaconEnabledForAccount(const std::string& account);

  // Hooks for received messages and session status changes; they do nothing.
  virtual void messageReceived(const vtc::Value& message);
  virtual void sessionStatusChanged(int32_t status);

  // Forgets the shared helper, so that the next
  // notificationSessionForAccount makes a new one (tests only).
  static void resetSharedHelperForTesting();
  // The dataclasses and payloads waiting for sendNotifications (tests).
  const std::optional<vtc::Dictionary>& queuedNotifications() const { return _notificationsToSend; }

 private:
  void _setAccount(const std::string& account);
  void _setPassword(const std::string& password);
  void _createSession();
  void _destroySession();
  // The account whose topics the helper uses.
  std::string topicAccount() const;

  std::string _clientID;
  std::string _account;
  std::string _password;
  std::unique_ptr<vtc::push::Session> _beaconSession;
  std::unique_ptr<vtc::SecretHold> _passwordHold;  // the process is not dumpable meanwhile
  std::optional<vtc::Dictionary> _notificationsToSend;
};
