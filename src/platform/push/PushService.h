// The push-notification service on MQTT: sessions, topics, publications,
// launch-on-push registrations and the session that opens at login.
//
// A session is one MQTT connection to the user's push server (the per-user
// preference "push_server_url", mqtt[s]://HOST[:PORT]) authenticated with
// the account and its password; over TLS it trusts the authority of
// "push_ca_file" (else the share's "tls_ca_file") and, when set, only the
// certificate pinned in "push_pinned_certificate". A topic is
// "<organisation>/<service>/<sub-service>/<account>/<dataclass>", the account
// and the dataclass escaped as topic levels (topicLevel), so that a broker's
// per-user rule ("pattern readwrite korvo/nubilo/syncdav/%u/#") confines each
// account to its own topics. A payload is a property list (binary form on
// the wire). Launchables and on-load sessions are kept in
// the registrations file (PushRegistry.h); the on-load session is the user
// service that runs `nubilosyncclient listen`.
//
// Statuses: 0 success, else an errno value (EINVAL a bad argument, ENOENT
// nothing registered, EIO a file or user-manager failure, ENOTCONN no
// session). Nothing raises.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "VantorSyncManager/Value.h"
#include "platform/push/MqttConnection.h"

namespace vtc::push {

inline constexpr const char* kPushServerKey = "push_server_url";
inline constexpr const char* kPushCaFileKey = "push_ca_file";
inline constexpr const char* kPushPinnedCertificateKey = "push_pinned_certificate";
inline constexpr const char* kTopicKey = "beacon.notify.topic";
inline constexpr const char* kListenerLabel = "com.korvo.NubiloPushListener";

enum EventKind : int { kSessionStatusEvent = 1, kMessageEvent = 5 };

class Session;
// kSessionStatusEvent: the value is an integer (1 connected, 0 not);
// kMessageEvent: a dictionary with "topic" and "payload".
using EventCallback = void (*)(int kind, Session* session, void* context, const Value& value);

class Session {
 public:
  Session(MqttConnection::Options options, EventCallback callback, void* context);
  MqttConnection& connection() { return connection_; }
  void notify(int kind, const Value& value) {
    if (callback_) callback_(kind, this, context_, value);
  }

 private:
  MqttConnection connection_;
  EventCallback callback_;
  void* context_;
};

// The push server this user set up, or none.
std::optional<BrokerAddress> configuredBroker();
// How a TLS connection to it trusts its certificate (the preferences above).
CertificateTrust configuredBrokerTrust();

// A connected session, or nothing (no push server set up, or it could not
// be reached or refused the account: a Warning line says why). Releasing
// the pointer releases the session.
std::unique_ptr<Session> createSession(const std::string& account, const std::string& password,
                                       EventCallback callback, void* context);

// The topic of a dataclass; the information dictionary holds it under
// kTopicKey. EINVAL when a part is empty, or the organisation, service or
// sub-service holds "/", "+", "#" or a zero byte.
int32_t createTopic(const std::string& account, const std::string& organisation,
                    const std::string& service, const std::string& subService,
                    const std::string& dataclass, std::optional<Dictionary>& topicInformation);

// The text as one topic level: "%", "/", "+", "#" and control characters
// written as "%XX", everything else as it is (so an account of letters,
// digits, "@", "." and "-" is its own level, as broker rules expect).
std::string topicLevel(std::string_view text);

// 32 lower-case hex digits of the account's SHA-256.
std::string accountDigest(const std::string& account);

// Publishes the payload on the topic and waits for the server to take it.
int32_t publish(Session* session, const Dictionary& topicInformation, const Value& payload);

// Registers (or replaces) the program to run with these arguments when a
// message arrives on the topic.
int32_t enableLaunchable(const std::string& tool, const Dictionary& topicInformation,
                         const std::vector<std::string>& arguments);
int32_t disableLaunchable(const std::string& tool,
                          const std::optional<Dictionary>& topicInformation);

// state: left at -1 when the registrations cannot be read, 2 when no
// session of the account opens at login, 1 when one does.
void hasOnLoadSession(const std::string& account, int32_t& state);
// Registers the account's session and installs and starts the listener
// service (a user manager's refusal is logged and gives EIO; the
// registration stays).
int32_t addOnLoadSession(const std::string& account, const std::string& domain,
                         const std::string& accountPlaceholder, const std::string& service);
// Removes the account's registration; the listener service goes with the
// last one.
int32_t removeOnLoadSession(const std::string& account);

}  // namespace vtc::push
