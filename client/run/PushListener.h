// The push listener (`nubilosyncclient listen`, the service that runs at
// login): it stays connected to the push server with this computer's own
// persistent session, subscribed to the topics registered for launch, and
// for a message from another computer runs the registered command
// (nubilosyncclient --sync --dataclasses NAME). A message that is no
// computer's announcement is ignored.
//
// One command runs at a time. A push that comes alone (the one before it is
// at least a quiet interval old) and finds nothing running starts its
// command at once; pushes that come in quick succession, or while a command
// runs, are folded into one run that starts once they have been quiet for
// that interval. A computer's own announcements are ignored. When the
// server goes away the listener reconnects with growing pauses (through the
// protocol sleeper), and after a reconnection runs every registered command
// once for what it may have missed. The registrations file is re-read when
// it changes. Not thread-safe: one thread runs a listener.
#pragma once

#include <sys/types.h>

#include <atomic>
#include <chrono>
#include <deque>
#include <functional>
#include <optional>
#include <string>
#include <vector>

#include "VantorSyncManager/Value.h"
#include "common/SecretMemory.h"
#include "platform/push/PushRegistry.h"

namespace vtc::client {

class PushListener {
 public:
  struct Options {
    std::chrono::milliseconds quiet{300};
    std::chrono::milliseconds tick{100};  // longest wait on the server in one turn
    // Called with each sentence worth telling a person who watches.
    std::function<void(const std::string&)> say;
  };

  // Raises SyncFailure when no account or no push server is set up.
  explicit PushListener(Options options);
  ~PushListener();
  // Runs until stop becomes true; waits for a command still running.
  void run(const std::atomic<bool>& stop);

 private:
  void handle(const std::string& topic, ByteView payload);
  void refreshRegistrations();
  void collect();   // notes the end of the running command
  void startDue();  // starts the next command when it is due
  void queue(const std::string& topic);

  Options options_;
  std::string member_, password_, guid_;
  std::optional<SecretHold> hold_;  // while the password is held
  std::vector<push::Launchable> launchables_;
  std::vector<std::string> subscribed_;
  std::optional<int64_t> registrationsStamp_;
  std::deque<std::string> pending_;  // topics whose command is due, each once
  pid_t running_ = -1;
  std::string runningTopic_;
  std::chrono::steady_clock::time_point lastPush_{};
  bool startNow_ = false;  // a push that came alone, to be answered at once
};

}  // namespace vtc::client
