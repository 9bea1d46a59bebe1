// A private mosquitto push server for one test: its own configuration under
// a temporary folder, one account (the share's member and password, kept
// hashed in a password file), optionally TLS with a self-signed certificate
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
