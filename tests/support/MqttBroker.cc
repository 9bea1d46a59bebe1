#include "support/MqttBroker.h"

#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <stdexcept>
#include <utility>

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

std::string readFile(const std::string& path) {
  std::ifstream in(path);
  if (!in) throw std::runtime_error("cannot read " + path);
  return std::string(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
}

// Replaces the whole line `from` of the guide's file, which must hold it.
void replaceLine(std::string& text, const std::string& from, const std::string& to) {
  const size_t at = text.find("\n" + from + "\n");
  if (at == std::string::npos)
    throw std::runtime_error("the guide's mosquitto.conf no longer holds \"" + from + "\"");
  text.replace(at + 1, from.size(), to);
}

}  // namespace

std::string MqttBroker::guideFile(const std::string& name) {
  return VSM_SOURCE_DIR "/docs/" + name;
}

MqttBroker::MqttBroker(Options options) : options_(options) {
  std::string tmpl = paths::join(paths::temporaryDirectory(), "vsm-mqtt-XXXXXX");
  if (!::mkdtemp(tmpl.data())) throw std::runtime_error("mkdtemp failed");
  root_ = tmpl;
  port_ = local::freeLoopbackPort();
  // The password goes through a file that mosquitto_passwd hashes in
  // place: never a command line.
  std::string accounts;
  for (const char* user : {local::ApacheShare::kUser, kPlusUser})
    accounts += std::string(user) + ":" + local::ApacheShare::kPassword + "\n";
  writeFile(root_ + "/passwords", accounts + kOtherUser + ":" + kOtherPassword + "\n");
  if (std::system(("mosquitto_passwd -U '" + root_ + "/passwords' >/dev/null 2>&1").c_str()) != 0)
    throw std::runtime_error("mosquitto_passwd failed");

  // The guide's rules, with its example of an account of its own made real.
  std::string rules = readFile(guideFile("mosquitto.acl"));
  for (const char* line : {"#   user ", "#   topic "}) {
    const size_t at = rules.find(line);
    if (at == std::string::npos)
      throw std::runtime_error(guideFile("mosquitto.acl") + " no longer shows \"" + line + "\"");
    rules += rules.substr(at + 4, rules.find('\n', at) - at - 4) + "\n";
  }
  writeFile(root_ + "/access", rules);

  // The guide's configuration, on a port and with files of our own.
  if (options_.tls) {
    const std::string make =
        "cd '" + root_ +
        "' && openssl req -x509 -newkey ec -pkeyopt ec_paramgen_curve:prime256v1 -nodes -days 2 "
        "-subj /CN=127.0.0.1 -addext subjectAltName=IP:127.0.0.1 -keyout server.key "
        "-out server.pem >/dev/null 2>&1";
    if (std::system(make.c_str()) != 0) throw std::runtime_error("openssl failed");
  }
  const std::pair<const char*, std::string> ours[] = {
      {"listener 8883", "listener " + std::to_string(port_) + " 127.0.0.1"},
      {"password_file /etc/mosquitto/nubilo.passwd", "password_file " + root_ + "/passwords"},
      {"acl_file /etc/mosquitto/nubilo.acl", "acl_file " + root_ + "/access"},
      {"certfile /etc/mosquitto/certs/push.pem",
       options_.tls ? "certfile " + certificateFile() : ""},
      {"keyfile /etc/mosquitto/certs/push.key",
       options_.tls ? "keyfile " + root_ + "/server.key" : ""}};
  std::string config = readFile(guideFile("mosquitto.conf"));
  for (const auto& [from, to] : ours) replaceLine(config, from, to);
  config += "persistence false\nlog_dest file " + root_ + "/broker.log\n";
  // Started as root, mosquitto would give up its rights and lose its files.
  if (::geteuid() == 0) config += "user root\n";
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
