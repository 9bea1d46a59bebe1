// `schedule on [--every N{s,m,h,d}] | off`, `push on | off` and `listen`.
#include <signal.h>

#include <atomic>
#include <ostream>

#include "client/cli/Commands.h"
#include "client/run/Automation.h"
#include "client/run/ClientSchedule.h"
#include "client/run/PushListener.h"
#include "client/run/SyncFailure.h"
#include "platform/push/PushService.h"
#include "prefs/AutoSyncJobs.h"

namespace vtc::client {

namespace {

std::atomic<bool> stopRequested{false};

void requestStop(int) {
  stopRequested = true;
}

void noteWithoutUserManager(const std::string& unit, const std::string& instead, Output& output) {
  if (userManagerHas(unit) || output.verbosity == 0) return;
  output.out << "No systemd user manager runs here (or it refused " << unit << "); " << instead
             << "\n";
}

}  // namespace

int scheduleCommand(bool on, const std::optional<std::string>& every, Output& output) {
  if (!on) {
    turnScheduleOff();
    if (output.verbosity > 0) output.out << "Scheduled syncs are off.\n";
    return 0;
  }
  std::optional<ScheduleEvery> interval;
  if (every) interval = ScheduleEvery::parse(*every);
  const ScheduleOutcome outcome = turnScheduleOn(interval);
  if (output.verbosity > 0) {
    output.out << "Scheduled syncs are on: " << outcome.cadence
               << "; a sync missed while this computer slept or was off runs when it is back.\n";
    if (!outcome.started)
      output.out << "No systemd user manager runs here (or it refused "
                 << std::string(kScheduleUnit) + ".timer"
                 << "); the schedule starts with the next session that has one. On a computer "
                    "without logins, `loginctl enable-linger` keeps one running.\n";
  }
  return 0;
}

int pushCommand(bool on, Output& output) {
  if (!on) {
    turnPushOff();
    if (output.verbosity > 0) output.out << "Push is off.\n";
    return 0;
  }
  turnPushOn();
  if (output.verbosity > 0)
    output.out << "Push is on: a change synced by another computer is synced here within "
                  "seconds, and this computer's changes are announced to the others.\n";
  noteWithoutUserManager(std::string(push::kListenerLabel) + ".service",
                         "run `nubilosyncclient listen` in your session to receive pushes.",
                         output);
  return 0;
}

int listenCommand(Output& output) {
  struct sigaction stop {};
  stop.sa_handler = requestStop;  // no SA_RESTART: a wait on the server returns at once
  sigaction(SIGTERM, &stop, nullptr);
  sigaction(SIGINT, &stop, nullptr);
  PushListener::Options options;
  options.say = [&](const std::string& sentence) {
    if (output.verbosity > 0) output.out << sentence << std::endl;
  };
  PushListener listener(options);
  listener.run(stopRequested);
  return 0;
}

}  // namespace vtc::client
