#include "support/SessionBus.h"

#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <systemd/sd-bus.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <stdexcept>
#include <utility>

#include "localshare/Processes.h"
#include "platform/bus/DistributedNotifications.h"

namespace vtc::test {

using local::startProcess;
using local::stopProcess;
using local::waitUntil;

namespace {

bool nameHasOwner(const char* name) {
  sd_bus* bus = nullptr;
  sd_bus_message* reply = nullptr;
  int has = 0;
  if (sd_bus_open_user(&bus) >= 0 &&
      sd_bus_call_method(bus, "org.freedesktop.DBus", "/org/freedesktop/DBus",
                         "org.freedesktop.DBus", "NameHasOwner", nullptr, &reply, "s", name) >= 0)
    sd_bus_message_read(reply, "b", &has);
  sd_bus_message_unref(reply);
  sd_bus_flush_close_unref(bus);
  return has;
}

// Whether something accepts connections on the socket: the daemon makes the
// file before it listens on it.
bool accepts(const std::string& socketPath) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  if (socketPath.size() >= sizeof address.sun_path) return false;
  socketPath.copy(address.sun_path, socketPath.size());
  const int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  const bool ok = ::connect(fd, reinterpret_cast<sockaddr*>(&address), sizeof address) == 0;
  ::close(fd);
  return ok;
}

}  // namespace

SessionBus::SessionBus() {
  char tmpl[] = "/tmp/vsm-bus-XXXXXX";
  if (!mkdtemp(tmpl)) throw std::runtime_error("mkdtemp failed");
  dir_ = tmpl;
  std::string address = "unix:path=" + dir_ + "/bus";
  busPid_ =
      startProcess({"dbus-daemon", "--session", "--nofork", "--nopidfile", "--address=" + address});
  if (!waitUntil([&] { return accepts(dir_ + "/bus"); })) {
    stopProcess(busPid_);
    throw std::runtime_error("dbus-daemon did not start");
  }
  if (const char* a = std::getenv("DBUS_SESSION_BUS_ADDRESS")) previousAddress_ = a;
  ::setenv("DBUS_SESSION_BUS_ADDRESS", address.c_str(), 1);
}

SessionBus::~SessionBus() {
  stopProcess(keyringPid_);
  stopProcess(busPid_);
  if (previousAddress_)
    ::setenv("DBUS_SESSION_BUS_ADDRESS", previousAddress_->c_str(), 1);
  else
    ::unsetenv("DBUS_SESSION_BUS_ADDRESS");
  std::error_code ignored;
  std::filesystem::remove_all(dir_, ignored);
}

void SessionBus::startKeyring() {
  std::string data = dir_ + "/data", runtime = dir_ + "/run";
  ::mkdir(data.c_str(), 0700);
  ::mkdir(runtime.c_str(), 0700);
  // Its keyrings live in the bus's folder, not in the real home.
  keyringPid_ =
      startProcess({"env", "HOME=" + dir_, "XDG_DATA_HOME=" + data, "XDG_RUNTIME_DIR=" + runtime,
                    "gnome-keyring-daemon", "--foreground", "--components=secrets", "--unlock"},
                   "test-keyring-password");
  if (!waitUntil([] { return nameHasOwner("org.freedesktop.secrets"); }))
    throw std::runtime_error("gnome-keyring-daemon did not start");
}

NotificationListener::NotificationListener() {
  sd_bus* bus = nullptr;
  if (sd_bus_open_user(&bus) < 0) throw std::runtime_error("no session bus");
  bus_ = bus;
  // The match is in place when this returns, so no later signal is missed;
  // it lives as long as the connection.
  auto onSignal = [](sd_bus_message* message, void* self, sd_bus_error*) {
    const char *name = nullptr, *object = nullptr, *info = nullptr;
    if (sd_bus_message_read(message, "sss", &name, &object, &info) >= 0)
      static_cast<NotificationListener*>(self)->received_.push_back({name, object, info});
    return 0;
  };
  if (sd_bus_match_signal(bus, nullptr, nullptr, nullptr, bus::kNotificationInterface,
                          bus::kNotificationMember, onSignal, this) < 0)
    throw std::runtime_error("cannot listen for notifications");
}

NotificationListener::~NotificationListener() {
  sd_bus_flush_close_unref(static_cast<sd_bus*>(bus_));
}

std::vector<NotificationListener::Received> NotificationListener::waitFor(
    std::chrono::milliseconds wait) {
  auto* bus = static_cast<sd_bus*>(bus_);
  auto deadline = std::chrono::steady_clock::now() + wait;
  while (received_.empty() && std::chrono::steady_clock::now() < deadline) {
    if (sd_bus_process(bus, nullptr) > 0) continue;
    sd_bus_wait(bus, 20000);
  }
  return std::exchange(received_, {});
}

}  // namespace vtc::test
