// A private mosquitto push server for one test, started from the guide's
// own files (docs/mosquitto.conf and docs/mosquitto.acl) with its port,
// password file and certificate in a temporary folder: three accounts (the
// share's member, one whose name holds a "+", given the lines the guide
// shows for such names, and another, kept hashed in a password file), each
// confined to its own topics; optionally TLS with a self-signed certificate
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
  // The guide's example of a name that no pattern rule applies to; its
  // password is the share member's.
  static constexpr const char* kPlusUser = "alice+sync@example.org";
  // A file of the guide, docs/NAME in the source tree.
  static std::string guideFile(const std::string& name);

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
