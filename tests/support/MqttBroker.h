// A private mosquitto push server for one test: its own configuration under
// a temporary folder, two accounts (the share's member and another, kept
// hashed in a password file) each confined to its own topics by the per-user
// rule that the README shows, optionally TLS with a self-signed certificate
// for 127.0.0.1. Started in the foreground on a free 127.0.0.1 port, stopped
// by its PID; it can be started again on the same port.
#pragma once

#include <sys/types.h>

#include <string>

namespace vtc::test {

class MqttBroker {
 public:
  struct Options {
    bool tls = false;
  };
  // The account besides the share's member.
  static constexpr const char* kOtherUser = "mallory";
  static constexpr const char* kOtherPassword = "another secret";
  // The rule each account is held to.
  static constexpr const char* kAccessRule = "pattern readwrite korvo/nubilo/syncdav/%u/#";

  MqttBroker() : MqttBroker(Options{}) {}
  explicit MqttBroker(Options options);
  ~MqttBroker();
  MqttBroker(const MqttBroker&) = delete;
  MqttBroker& operator=(const MqttBroker&) = delete;

  int port() const { return port_; }
  pid_t pid() const { return pid_; }
  // mqtt://127.0.0.1:PORT, or mqtts://… for a TLS server.
  std::string url() const;
  // The certificate to trust for a TLS server (point SSL_CERT_FILE at it).
  std::string certificateFile() const { return root_ + "/server.pem"; }

  void stop();
  // Starts it again on the same port (after stop()).
  void start();

 private:
  Options options_;
  std::string root_;
  int port_ = 0;
  pid_t pid_ = -1;
};

}  // namespace vtc::test
