// A private D-Bus session bus for one test (dbus-daemon on a socket in a
// temporary folder), optionally with an unlocked Secret Service on it
// (gnome-keyring-daemon). Both are stopped by PID. While a SessionBus lives,
// DBUS_SESSION_BUS_ADDRESS names it.
#pragma once

#include <sys/types.h>

#include <chrono>
#include <optional>
#include <string>
#include <vector>

namespace vtc::test {

class SessionBus {
 public:
  SessionBus();
  ~SessionBus();
  SessionBus(const SessionBus&) = delete;
  SessionBus& operator=(const SessionBus&) = delete;

  // Starts gnome-keyring-daemon's secrets component on this bus, unlocked.
  void startKeyring();

 private:
  std::string dir_;
  std::optional<std::string> previousAddress_;
  pid_t busPid_ = -1;
  pid_t keyringPid_ = -1;
};

// Listens on the session bus for the library's notification signals.
class NotificationListener {
 public:
  struct Received {
    std::string name, object, information;
  };
  NotificationListener();
  ~NotificationListener();
  // Processes the bus until a signal arrives or the wait runs out.
  std::vector<Received> waitFor(std::chrono::milliseconds wait);

 private:
  void* bus_ = nullptr;  // an sd_bus
  std::vector<Received> received_;
};

}  // namespace vtc::test
