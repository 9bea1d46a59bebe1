#include "platform/push/MqttConnection.h"

#include <mosquitto.h>
#include <mqtt_protocol.h>
#include <netdb.h>
#include <openssl/evp.h>
#include <openssl/ssl.h>
#include <openssl/x509v3.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <mutex>
#include <regex>

#include "common/Format.h"
#include "common/Limits.h"
#include "common/Logging.h"
#include "platform/network/PlainConnection.h"

namespace vtc::push {

namespace {

void initialiseOnce() {
  static std::once_flag once;
  std::call_once(once, [] { mosquitto_lib_init(); });
}

// Whether a TCP connection to the server opens within the timeout. The
// library's own connect waits as long as the system does (minutes, for a
// server whose packets vanish); a sync that announces its commit must not.
bool answersWithin(const BrokerAddress& broker, std::chrono::milliseconds timeout,
                   std::string& error) {
  addrinfo hints{};
  hints.ai_socktype = SOCK_STREAM;
  addrinfo* found = nullptr;
  const int rc =
      ::getaddrinfo(broker.host.c_str(), std::to_string(broker.port).c_str(), &hints, &found);
  if (rc != 0) {
    error = "cannot find " + broker.host + ": " + ::gai_strerror(rc);
    return false;
  }
  std::unique_ptr<addrinfo, decltype(&::freeaddrinfo)> addresses(found, &::freeaddrinfo);
  error = "no address of " + broker.host;
  for (const addrinfo* a = found; a; a = a->ai_next) {
    const int fd = ::socket(a->ai_family, a->ai_socktype | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
    if (fd < 0) continue;
    bool open = ::connect(fd, a->ai_addr, a->ai_addrlen) == 0;
    if (!open && errno == EINPROGRESS) {
      pollfd p{fd, POLLOUT, 0};
      int soError = 0;
      socklen_t length = sizeof soError;
      open = ::poll(&p, 1, static_cast<int>(timeout.count())) == 1 &&
             ::getsockopt(fd, SOL_SOCKET, SO_ERROR, &soError, &length) == 0 && soError == 0;
      if (!open) errno = soError ? soError : ETIMEDOUT;
    }
    if (!open) error = std::strerror(errno);
    ::close(fd);
    if (open) return true;
  }
  return false;
}

std::string reasonOf(int rc) {
  if (rc == MOSQ_ERR_ERRNO) return std::strerror(errno);
  return mosquitto_strerror(rc);
}

// Room in a packet beside its payload: the topic and the headers.
constexpr uint32_t kPacketOverhead = 1024;

// Certificate failures that only say no trusted authority vouches.
bool onlyUntrusted(int error) {
  switch (error) {
    case X509_V_ERR_DEPTH_ZERO_SELF_SIGNED_CERT:
    case X509_V_ERR_SELF_SIGNED_CERT_IN_CHAIN:
    case X509_V_ERR_UNABLE_TO_GET_ISSUER_CERT:
    case X509_V_ERR_UNABLE_TO_GET_ISSUER_CERT_LOCALLY:
    case X509_V_ERR_UNABLE_TO_VERIFY_LEAF_SIGNATURE:
    case X509_V_ERR_CERT_UNTRUSTED:
      return true;
    default:
      return false;
  }
}

// The SHA-256 digest of a certificate as colon-separated lower-case hex
// pairs, the form in which the share's certificates are pinned.
std::string digestOf(X509* cert) {
  unsigned char md[EVP_MAX_MD_SIZE];
  unsigned int length = 0;
  if (!cert || X509_digest(cert, EVP_sha256(), md, &length) != 1) return {};
  std::string out;
  for (unsigned int i = 0; i < length; ++i) out += format(i ? ":%02x" : "%02x", md[i]);
  return out;
}

}  // namespace

std::optional<BrokerAddress> BrokerAddress::parse(const std::string& url) {
  static const std::regex form(R"(^(mqtts?)://([^/:\s]+|\[[0-9A-Fa-f:.]+\])(?::(\d{1,5}))?/?$)");
  std::smatch m;
  if (!std::regex_match(url, m, form)) return std::nullopt;
  BrokerAddress a;
  a.tls = m[1] == "mqtts";
  a.host = m[2];
  if (a.host.starts_with("[")) a.host = a.host.substr(1, a.host.size() - 2);
  a.port = m[3].matched ? std::stoi(m[3]) : (a.tls ? 8883 : 1883);
  if (a.port < 1 || a.port > 65535) return std::nullopt;
  return a;
}

std::string BrokerAddress::url() const {
  const bool usual = port == (tls ? 8883 : 1883);
  const std::string shownHost = host.find(':') != std::string::npos ? "[" + host + "]" : host;
  return std::string(tls ? "mqtts" : "mqtt") + "://" + shownHost +
         (usual ? "" : ":" + std::to_string(port));
}

MqttConnection::MqttConnection(Options options) : options_(std::move(options)) {
  if (!options_.password.empty()) hold_.emplace();
  initialiseOnce();
  mosq_ = mosquitto_new(options_.clientId.c_str(), options_.cleanSession, this);
  if (!mosq_) return;
  mosquitto_int_option(mosq_, MOSQ_OPT_PROTOCOL_VERSION, MQTT_PROTOCOL_V5);
  mosquitto_connect_callback_set(mosq_, &MqttConnection::onConnect);
  mosquitto_disconnect_callback_set(mosq_, &MqttConnection::onDisconnect);
  mosquitto_publish_callback_set(mosq_, &MqttConnection::onPublish);
  mosquitto_subscribe_callback_set(mosq_, &MqttConnection::onSubscribe);
  mosquitto_unsubscribe_callback_set(mosq_, &MqttConnection::onUnsubscribe);
  mosquitto_message_callback_set(mosq_, &MqttConnection::onMessage);
}

MqttConnection::~MqttConnection() {
  if (!mosq_) return;
  if (connected_) {
    mosquitto_disconnect(mosq_);
    mosquitto_loop(mosq_, 0, 1);  // sends the DISCONNECT
  }
  mosquitto_destroy(mosq_);
  if (tls_) SSL_CTX_free(tls_);
  wipe(options_.password);
}

void MqttConnection::onConnect(mosquitto*, void* self, int rc) {
  auto* c = static_cast<MqttConnection*>(self);
  c->connectResult_ = rc;
  c->connected_ = rc == 0;
}

void MqttConnection::onDisconnect(mosquitto*, void* self, int) {
  static_cast<MqttConnection*>(self)->connected_ = false;
}

void MqttConnection::onPublish(mosquitto*, void* self, int mid) {
  static_cast<MqttConnection*>(self)->acknowledged_.push_back(mid);
}

void MqttConnection::onSubscribe(mosquitto*, void* self, int mid, int, const int*) {
  static_cast<MqttConnection*>(self)->acknowledged_.push_back(mid);
}

void MqttConnection::onUnsubscribe(mosquitto*, void* self, int mid) {
  static_cast<MqttConnection*>(self)->acknowledged_.push_back(mid);
}

void MqttConnection::onMessage(mosquitto*, void* self, const mosquitto_message* message) {
  auto* c = static_cast<MqttConnection*>(self);
  if (!c->handler_ || !message->topic) return;
  const uint64_t most = limits().pushMessageBytes;
  if (static_cast<uint64_t>(std::max(0, message->payloadlen)) > most) {
    // Only a server that ignores the size it was told sends one.
    if (c->dropped_++ % 100 == 0)
      VTC_LOG_WARNING("Dropped a push message on %@: %@", clipped(message->topic, 200),
                      overLimitText(format("a message of %d bytes", message->payloadlen), most,
                                    Limits::kPushMessageKey));
    return;
  }
  const auto* bytes = static_cast<const uint8_t*>(message->payload);
  c->handler_(Message{message->topic, Bytes(bytes, bytes + std::max(0, message->payloadlen))});
}

bool MqttConnection::waitFor(const std::function<bool()>& done, std::string& error,
                             const char* what) {
  const auto deadline = std::chrono::steady_clock::now() + options_.timeout;
  while (!done()) {
    const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
        deadline - std::chrono::steady_clock::now());
    if (left.count() <= 0) {
      error = std::string("the push server did not answer the ") + what + " in time";
      return false;
    }
    const int rc = mosquitto_loop(mosq_, static_cast<int>(std::min<int64_t>(left.count(), 100)), 1);
    if (rc != MOSQ_ERR_SUCCESS && !done()) {
      connected_ = false;
      error = std::string("the connection to the push server broke during the ") + what + ": " +
              reasonOf(rc);
      return false;
    }
  }
  return true;
}

bool MqttConnection::prepareTls(std::string& error) {
  if (tls_) return true;
  tls_ = SSL_CTX_new(TLS_client_method());
  if (!tls_) {
    error = "no TLS context could be made";
    return false;
  }
  SSL_CTX_set_min_proto_version(tls_, TLS1_2_VERSION);
  SSL_CTX_set_default_verify_paths(tls_);
  if (!options_.trust.caFile.empty() &&
      SSL_CTX_load_verify_locations(tls_, options_.trust.caFile.c_str(), nullptr) != 1) {
    error = "the authority's certificate " + options_.trust.caFile + " cannot be read";
    return false;
  }
  X509_VERIFY_PARAM* param = SSL_CTX_get0_param(tls_);
  if (X509_VERIFY_PARAM_set1_ip_asc(param, options_.broker.host.c_str()) != 1)
    X509_VERIFY_PARAM_set1_host(param, options_.broker.host.c_str(), 0);
  SSL_CTX_set_app_data(tls_, this);
  SSL_CTX_set_verify(tls_, SSL_VERIFY_PEER, &MqttConnection::verifyCertificate);
  mosquitto_int_option(mosq_, MOSQ_OPT_SSL_CTX_WITH_DEFAULTS, 0);  // this context as it is
  mosquitto_void_option(mosq_, MOSQ_OPT_SSL_CTX, tls_);
  return true;
}

int MqttConnection::verifyCertificate(int preverified, X509_STORE_CTX* context) {
  auto* ssl =
      static_cast<SSL*>(X509_STORE_CTX_get_ex_data(context, SSL_get_ex_data_X509_STORE_CTX_idx()));
  auto* self = static_cast<MqttConnection*>(SSL_CTX_get_app_data(SSL_get_SSL_CTX(ssl)));
  self->certificateDigest_ = digestOf(X509_STORE_CTX_get0_cert(context));
  const int failure = X509_STORE_CTX_get_error(context);
  // Expired, another name, a broken chain: refused, pinned or not.
  if (!preverified && !onlyUntrusted(failure)) {
    self->refusal_ = CertificateRefusal::Invalid;
    return 0;
  }
  const std::string& pinned = self->options_.trust.pinnedDigest;
  if (!pinned.empty()) {
    if (self->certificateDigest_ == pinned) return 1;  // the pinned one alone decides
    self->refusal_ = CertificateRefusal::Changed;
    return 0;
  }
  if (!preverified) self->refusal_ = CertificateRefusal::Untrusted;
  return preverified;
}

bool MqttConnection::connect(std::string& error) {
  if (!mosq_) {
    error = "no MQTT client could be made";
    return false;
  }
  if (!options_.username.empty())
    mosquitto_username_pw_set(mosq_, options_.username.c_str(), options_.password.c_str());
  refusal_.reset();
  if (options_.broker.tls && !prepareTls(error)) return false;
  if (!options_.broker.tls && !options_.password.empty())
    if (auto warning = network::passwordInClearWarning(options_.username, options_.broker.host,
                                                       options_.broker.url(), "MQTT"))
      VTC_LOG_WARNING("%@", *warning);
  connectResult_ = -1;
  connected_ = false;
  std::string unreachable;
  if (!answersWithin(options_.broker, options_.timeout, unreachable)) {
    error = "cannot reach the push server at " + options_.broker.url() + ": " + unreachable;
    return false;
  }
  const int keepAlive = 30;
  // The largest packet this client takes; a server keeps larger ones back.
  mosquitto_property* properties = nullptr;
  const uint64_t most = limits().pushMessageBytes + kPacketOverhead;
  mosquitto_property_add_int32(&properties, MQTT_PROP_MAXIMUM_PACKET_SIZE,
                               static_cast<uint32_t>(std::min<uint64_t>(most, UINT32_MAX)));
  int rc = mosquitto_connect_bind_v5(mosq_, options_.broker.host.c_str(), options_.broker.port,
                                     keepAlive, nullptr, properties);
  mosquitto_property_free_all(&properties);
  // The handshake may end in mosquitto_connect or in the wait after it.
  auto refused = [&] {
    if (!refusal_) return false;
    error = "the push server at " + options_.broker.url() + " " +
            (*refusal_ == CertificateRefusal::Changed
                 ? "shows a certificate other than the pinned one (its SHA-256 digest is now " +
                       certificateDigest_ + ")"
             : *refusal_ == CertificateRefusal::Untrusted
                 ? "has a certificate that no authority this computer trusts vouches for"
                 : "has a certificate that is expired, issued to another name or badly chained");
    return true;
  };
  if (rc != MOSQ_ERR_SUCCESS) {
    if (!refused())
      error = "cannot reach the push server at " + options_.broker.url() + ": " + reasonOf(rc);
    return false;
  }
  if (!waitFor([&] { return connectResult_ >= 0; }, error, "connection")) {
    refused();
    return false;
  }
  if (connectResult_ != 0) {
    error = "the push server at " + options_.broker.url() +
            " refused the connection: " + mosquitto_reason_string(connectResult_);
    return false;
  }
  return true;
}

bool MqttConnection::publish(const std::string& topic, ByteView payload, std::string& error) {
  acknowledged_.clear();  // every wait is for the one request just sent
  int mid = 0;
  const int rc = mosquitto_publish(mosq_, &mid, topic.c_str(), static_cast<int>(payload.size()),
                                   payload.data(), 1, false);
  if (rc != MOSQ_ERR_SUCCESS) {
    error = "cannot publish on " + topic + ": " + reasonOf(rc);
    return false;
  }
  return waitFor([&] { return std::ranges::count(acknowledged_, mid) > 0; }, error, "publication");
}

bool MqttConnection::subscribe(const std::vector<std::string>& topics, std::string& error) {
  for (const std::string& topic : topics) {
    acknowledged_.clear();
    int mid = 0;
    const int rc = mosquitto_subscribe(mosq_, &mid, topic.c_str(), 1);
    if (rc != MOSQ_ERR_SUCCESS) {
      error = "cannot subscribe to " + topic + ": " + reasonOf(rc);
      return false;
    }
    if (!waitFor([&] { return std::ranges::count(acknowledged_, mid) > 0; }, error, "subscription"))
      return false;
  }
  return true;
}

bool MqttConnection::unsubscribe(const std::vector<std::string>& topics, std::string& error) {
  for (const std::string& topic : topics) {
    acknowledged_.clear();
    int mid = 0;
    const int rc = mosquitto_unsubscribe(mosq_, &mid, topic.c_str());
    if (rc != MOSQ_ERR_SUCCESS) {
      error = "cannot unsubscribe from " + topic + ": " + reasonOf(rc);
      return false;
    }
    if (!waitFor([&] { return std::ranges::count(acknowledged_, mid) > 0; }, error,
                 "unsubscription"))
      return false;
  }
  return true;
}

bool MqttConnection::poll(std::chrono::milliseconds wait) {
  if (!mosq_ || !connected_) return false;
  const int rc = mosquitto_loop(mosq_, static_cast<int>(wait.count()), 1);
  if (rc != MOSQ_ERR_SUCCESS) connected_ = false;
  return connected_;
}

}  // namespace vtc::push
