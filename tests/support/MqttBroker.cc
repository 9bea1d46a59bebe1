#include "support/MqttBroker.h"

#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <stdexcept>

#include "localshare/ApacheShare.h"
#include "localshare/Processes.h"
#include "platform/fs/LocalPaths.h"

namespace vtc::test {

namespace {

void writeFile(const std::string& path, const std::string& text) {
  std::ofstream out(path);
  out << text;
  if (!out) throw std::runtime_error("cannot write " + path);
}

}  // namespace

MqttBroker::MqttBroker(Options options) : options_(options) {
  std::string tmpl = paths::join(paths::temporaryDirectory(), "vsm-mqtt-XXXXXX");
  if (!::mkdtemp(tmpl.data())) throw std::runtime_error("mkdtemp failed");
  root_ = tmpl;
  port_ = local::freeLoopbackPort();
  // The password goes through a file that mosquitto_passwd hashes in
  // place: never a command line.
  writeFile(root_ + "/passwords", std::string(local::ApacheShare::kUser) + ":" +
                                      local::ApacheShare::kPassword + "\n" + kOtherUser + ":" +
                                      kOtherPassword + "\n");
  writeFile(root_ + "/access", std::string(kAccessRule) + "\n");
  if (std::system(("mosquitto_passwd -U '" + root_ + "/passwords' >/dev/null 2>&1").c_str()) != 0)
    throw std::runtime_error("mosquitto_passwd failed");
  std::string config = "listener " + std::to_string(port_) + " 127.0.0.1\n" +
                       "allow_anonymous false\npassword_file " + root_ + "/passwords\nacl_file " +
                       root_ + "/access\npersistence false\nlog_dest file " + root_ +
                       "/broker.log\n";
  // Started as root, mosquitto would give up its rights and lose its files.
  if (::geteuid() == 0) config += "user root\n";
  if (options_.tls) {
    const std::string make =
        "cd '" + root_ +
        "' && openssl req -x509 -newkey ec -pkeyopt ec_paramgen_curve:prime256v1 -nodes -days 2 "
        "-subj /CN=127.0.0.1 -addext subjectAltName=IP:127.0.0.1 -keyout server.key "
        "-out server.pem >/dev/null 2>&1";
    if (std::system(make.c_str()) != 0) throw std::runtime_error("openssl failed");
    config += "certfile " + certificateFile() + "\nkeyfile " + root_ + "/server.key\n";
  }
  writeFile(root_ + "/mosquitto.conf", config);
  start();
}

MqttBroker::~MqttBroker() {
  stop();
  std::error_code ignored;
  std::filesystem::remove_all(root_, ignored);
}

std::string MqttBroker::url() const {
  return std::string(options_.tls ? "mqtts" : "mqtt") + "://127.0.0.1:" + std::to_string(port_);
}

void MqttBroker::stop() {
  local::stopProcess(pid_);
}

void MqttBroker::start() {
  pid_ = local::startProcess({"mosquitto", "-c", root_ + "/mosquitto.conf"});
  const bool listening = local::waitUntil([&] {
    if (::waitpid(pid_, nullptr, WNOHANG) == pid_) pid_ = -1;  // it gave up
    const int fd = pid_ < 0 ? -1 : local::connectLoopback(port_);
    if (fd >= 0) ::close(fd);
    return pid_ < 0 || fd >= 0;
  });
  if (pid_ < 0 || !listening) {
    stop();
    throw std::runtime_error("mosquitto did not start on port " + std::to_string(port_));
  }
}

}  // namespace vtc::test
