#include "platform/push/MqttConnection.h"

#include <mosquitto.h>
#include <netdb.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <mutex>
#include <regex>

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
  initialiseOnce();
  mosq_ = mosquitto_new(options_.clientId.c_str(), options_.cleanSession, this);
  if (!mosq_) return;
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

bool MqttConnection::connect(std::string& error) {
  if (!mosq_) {
    error = "no MQTT client could be made";
    return false;
  }
  if (!options_.username.empty())
    mosquitto_username_pw_set(mosq_, options_.username.c_str(), options_.password.c_str());
  if (options_.broker.tls) mosquitto_int_option(mosq_, MOSQ_OPT_TLS_USE_OS_CERTS, 1);
  connectResult_ = -1;
  connected_ = false;
  std::string unreachable;
  if (!answersWithin(options_.broker, options_.timeout, unreachable)) {
    error = "cannot reach the push server at " + options_.broker.url() + ": " + unreachable;
    return false;
  }
  const int keepAlive = 30;
  int rc = mosquitto_connect(mosq_, options_.broker.host.c_str(), options_.broker.port, keepAlive);
  if (rc != MOSQ_ERR_SUCCESS) {
    error = "cannot reach the push server at " + options_.broker.url() + ": " + reasonOf(rc);
    return false;
  }
  if (!waitFor([&] { return connectResult_ >= 0; }, error, "connection")) return false;
  if (connectResult_ != 0) {
    error = "the push server at " + options_.broker.url() +
            " refused the connection: " + mosquitto_connack_string(connectResult_);
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
