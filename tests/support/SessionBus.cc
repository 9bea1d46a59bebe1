#include "support/SessionBus.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <systemd/sd-bus.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <stdexcept>
#include <thread>

#include "platform/bus/DistributedNotifications.h"
#include "support/Processes.h"

namespace vtc::test {

namespace {

bool nameHasOwner(const char* name) {
  sd_bus* bus = nullptr;
  if (sd_bus_open_user(&bus) < 0) return false;
  sd_bus_message* reply = nullptr;
  int has = 0;
  int r = sd_bus_call_method(bus, "org.freedesktop.DBus", "/org/freedesktop/DBus",
                             "org.freedesktop.DBus", "NameHasOwner", nullptr, &reply, "s", name);
  if (r >= 0) sd_bus_message_read(reply, "b", &has);
  sd_bus_message_unref(reply);
  sd_bus_flush_close_unref(bus);
  return r >= 0 && has;
}

}  // namespace

SessionBus::SessionBus() {
  char tmpl[] = "/tmp/vsm-bus-XXXXXX";
  if (!mkdtemp(tmpl)) throw std::runtime_error("mkdtemp failed");
  dir_ = tmpl;
  std::string socket = dir_ + "/bus";
  address_ = "unix:path=" + socket;
  busPid_ = ::fork();
  if (busPid_ == 0) {
    ::prctl(PR_SET_PDEATHSIG, SIGTERM);  // gone with a test process that crashes
    int devnull = ::open("/dev/null", O_RDWR);
    ::dup2(devnull, 0);
    ::dup2(devnull, 1);
    ::dup2(devnull, 2);
    ::execlp("dbus-daemon", "dbus-daemon", "--session", "--nofork", "--nopidfile",
             ("--address=" + address_).c_str(), static_cast<char*>(nullptr));
    ::_exit(127);
  }
  for (int i = 0; i < 500 && !std::filesystem::exists(socket); ++i)
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  if (!std::filesystem::exists(socket)) {
    stopProcess(busPid_);
    throw std::runtime_error("dbus-daemon did not start");
  }
  if (const char* a = std::getenv("DBUS_SESSION_BUS_ADDRESS")) previousAddress_ = a;
  ::setenv("DBUS_SESSION_BUS_ADDRESS", address_.c_str(), 1);
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
  std::filesystem::create_directories(data);
  std::filesystem::create_directories(runtime);
  ::chmod(runtime.c_str(), 0700);
  int input[2];
  if (::pipe(input) != 0) throw std::runtime_error("pipe failed");
  keyringPid_ = ::fork();
  if (keyringPid_ == 0) {
    ::prctl(PR_SET_PDEATHSIG, SIGTERM);
    // Its keyrings live in the bus's folder, not in the real home.
    ::setenv("HOME", dir_.c_str(), 1);
    ::setenv("XDG_DATA_HOME", data.c_str(), 1);
    ::setenv("XDG_RUNTIME_DIR", runtime.c_str(), 1);
    ::dup2(input[0], 0);
    ::close(input[1]);
    int devnull = ::open("/dev/null", O_RDWR);
    ::dup2(devnull, 1);
    ::dup2(devnull, 2);
    ::execlp("gnome-keyring-daemon", "gnome-keyring-daemon", "--foreground", "--components=secrets",
             "--unlock", static_cast<char*>(nullptr));
    ::_exit(127);
  }
  ::close(input[0]);
  const char password[] = "test-keyring-password";
  (void)!::write(input[1], password, sizeof password - 1);
  ::close(input[1]);
  for (int i = 0; i < 500; ++i) {
    if (nameHasOwner("org.freedesktop.secrets")) return;
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  throw std::runtime_error("gnome-keyring-daemon did not start");
}

NotificationListener::NotificationListener() {
  sd_bus* bus = nullptr;
  if (sd_bus_open_user(&bus) < 0) throw std::runtime_error("no session bus");
  bus_ = bus;
  std::string match = std::string("type='signal',interface='") + bus::kNotificationInterface +
                      "',member='" + bus::kNotificationMember + "'";
  sd_bus_slot* slot = nullptr;
  sd_bus_add_match(bus, &slot, match.c_str(),
                   reinterpret_cast<sd_bus_message_handler_t>(&NotificationListener::onSignal),
                   this);
  slot_ = slot;
  // Make sure the match is installed before anything is posted.
  sd_bus_call_method(bus, "org.freedesktop.DBus", "/org/freedesktop/DBus",
                     "org.freedesktop.DBus.Peer", "Ping", nullptr, nullptr, "");
}

NotificationListener::~NotificationListener() {
  sd_bus_slot_unref(static_cast<sd_bus_slot*>(slot_));
  sd_bus_flush_close_unref(static_cast<sd_bus*>(bus_));
}

int NotificationListener::onSignal(void* message, void* userdata, void*) {
  auto* self = static_cast<NotificationListener*>(userdata);
  const char *name = nullptr, *object = nullptr, *info = nullptr;
  if (sd_bus_message_read(static_cast<sd_bus_message*>(message), "sss", &name, &object, &info) >= 0)
    self->received_.push_back({name, object, info});
  return 0;
}

std::vector<NotificationListener::Received> NotificationListener::waitFor(
    std::chrono::milliseconds wait) {
  auto* bus = static_cast<sd_bus*>(bus_);
  auto deadline = std::chrono::steady_clock::now() + wait;
  while (received_.empty() && std::chrono::steady_clock::now() < deadline) {
    int r = sd_bus_process(bus, nullptr);
    if (r > 0) continue;
    sd_bus_wait(bus, 20000);
  }
  auto out = std::move(received_);
  received_.clear();
  return out;
}

}  // namespace vtc::test
