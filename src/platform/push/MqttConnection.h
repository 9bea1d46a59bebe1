// One MQTT connection to a push server through libmosquitto, driven by the
// thread that calls it: the library starts no thread, so messages arrive
// only while poll() runs. It speaks MQTT 5 and tells the server the largest
// message it takes (the limits' push message cap), so that a server that
// keeps to the protocol never sends a larger one; one that does is dropped
// unread. Over TLS it trusts the system's authorities and one more when
// named, or a pinned certificate alone, as the share's connection does.
// Over plain MQTT the password travels unencrypted: a Warning line says so
// at every connection to another computer. While it holds a password the process is not
// dumpable. Not thread-safe; one thread uses a connection.
#pragma once

#include <chrono>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "VantorSyncManager/Value.h"
#include "common/SecretMemory.h"
#include "platform/dav/ServerCertificate.h"

struct mosquitto;
struct mosquitto_message;
struct ssl_ctx_st;
struct x509_store_ctx_st;

namespace vtc::push {

// mqtt://HOST[:PORT] (1883) or mqtts://HOST[:PORT] (8883, TLS).
struct BrokerAddress {
  bool tls = false;
  std::string host;
  int port = 0;

  static std::optional<BrokerAddress> parse(const std::string& url);
  std::string url() const;
};

class MqttConnection {
 public:
  struct Options {
    BrokerAddress broker;
    std::string clientId;
    std::string username;
    std::string password;  // kept in memory only, never logged
    // false: the broker keeps the subscriptions and the messages that
    // arrive while this client is away, for the next connection of the id.
    bool cleanSession = true;
    std::chrono::milliseconds timeout{3000};  // for each wait on the broker
    CertificateTrust trust;                   // for TLS
  };
  struct Message {
    std::string topic;
    Bytes payload;
  };

  explicit MqttConnection(Options options);
  ~MqttConnection();
  MqttConnection(const MqttConnection&) = delete;
  MqttConnection& operator=(const MqttConnection&) = delete;

  // Connects and waits for the broker's acceptance. TLS trusts the system's
  // authorities (SSL_CERT_FILE and SSL_CERT_DIR point it elsewhere) and the
  // trust's, or the pinned certificate alone, and checks the host name.
  // False with a sentence in error.
  bool connect(std::string& error);
  bool connected() const { return connected_; }
  // The digest of the certificate the server showed last (TLS), for the
  // caller to pin; and why it was refused, if it was.
  const std::string& certificateDigest() const { return certificateDigest_; }
  std::optional<CertificateRefusal> certificateRefusal() const { return refusal_; }
  // Publishes at least once (QoS 1) and waits for the acknowledgment.
  bool publish(const std::string& topic, ByteView payload, std::string& error);
  // Subscribes (QoS 1) and waits for the acknowledgment.
  bool subscribe(const std::vector<std::string>& topics, std::string& error);
  bool unsubscribe(const std::vector<std::string>& topics, std::string& error);
  // Handles traffic for up to `wait`, handing each message to the handler;
  // false once the connection is lost.
  bool poll(std::chrono::milliseconds wait);
  void setMessageHandler(std::function<void(const Message&)> handler) {
    handler_ = std::move(handler);
  }

 private:
  static void onConnect(mosquitto*, void* self, int rc);
  static void onDisconnect(mosquitto*, void* self, int rc);
  static void onPublish(mosquitto*, void* self, int mid);
  static void onSubscribe(mosquitto*, void* self, int mid, int count, const int* granted);
  static void onUnsubscribe(mosquitto*, void* self, int mid);
  static void onMessage(mosquitto*, void* self, const mosquitto_message* message);
  // Loops until done() holds, the connection drops or the timeout passes.
  bool waitFor(const std::function<bool()>& done, std::string& error, const char* what);

  // Makes the TLS context that judges the server's certificate.
  bool prepareTls(std::string& error);
  static int verifyCertificate(int preverified, ::x509_store_ctx_st* context);

  Options options_;
  std::optional<SecretHold> hold_;
  mosquitto* mosq_ = nullptr;
  ::ssl_ctx_st* tls_ = nullptr;
  std::string certificateDigest_;
  std::optional<CertificateRefusal> refusal_;
  uint64_t dropped_ = 0;  // messages over the cap
  bool connected_ = false;
  int connectResult_ = -1;  // the broker's answer, -1 until it comes
  std::vector<int> acknowledged_;
  std::function<void(const Message&)> handler_;
};

}  // namespace vtc::push
