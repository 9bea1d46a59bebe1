// Syncs that start by themselves: the schedule (the periodic job of the
// user manager) and push (this computer's edits announced on the push
// server, other computers' announcements answered by the listener).
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "VantorSyncManager/Value.h"

namespace vtc::client {

// An interval as typed after --every: a count and a unit letter, "45s",
// "30m", "1h" or "1d". Raises SyncFailure (Usage) for anything else.
struct ScheduleEvery {
  int32_t interval = 0;
  int32_t unit = 0;  // as the preferences keep it: 0 minutes, 1 hours, 2 days, 3 seconds
  static ScheduleEvery parse(const std::string& text);
};

struct AutomationState {
  bool scheduleOn = false;
  std::string cadence;  // "every 30 minutes"; empty when the schedule is off
  std::optional<Date> nextScheduledSync;
  bool pushOn = false;
  std::string pushServer;  // as set up; empty when none is
};

// What status shows; asks nothing of the servers.
AutomationState automationState();

// Turns the client's schedule on (ClientSchedule.h), with the interval
// given or else the one it had (hourly when none): the cadence it runs at,
// and whether the user manager started it.
struct ScheduleOutcome {
  std::string cadence;
  bool started = false;
};
ScheduleOutcome turnScheduleOn(const std::optional<ScheduleEvery>& every);
void turnScheduleOff();

// Checks a push server address (mqtt[s]://HOST[:PORT]) and gives it in its
// usual form; raises SyncFailure (Usage).
std::string checkedPushServer(const std::string& url);
// Keeps the push server among the account's settings.
void storePushServer(const std::string& url);

// Registers this computer's dataclasses to be synced on a push and the
// listener to start at login. Raises SyncFailure when no push server is set
// up or it cannot be reached with the account.
void turnPushOn();
void turnPushOff();
// A folder added or removed while push is on is registered or unregistered.
void followAddedFolder(const std::string& dataclass);
void followRemovedFolder(const std::string& dataclass);

// Whether the user manager has the unit enabled (false without a manager).
bool userManagerHas(const std::string& unit);

// Announces the dataclasses this computer just committed, with its client
// guid as the payload, when a push server is set up. Failures are logged.
void announceCommits(const std::string& member, const std::string& password,
                     const std::vector<std::string>& dataclasses);

}  // namespace vtc::client
