// The one clock and the one sleeper. Every wait of the protocol (credential
// and lock retries, not-found pauses) goes through currentSleeper(), so tests
// install a sleeper that records durations instead of sleeping.
#pragma once

#include <chrono>

#include "VantorSyncManager/Value.h"

namespace vtc {

using Seconds = std::chrono::duration<double>;

class Clock {
 public:
  virtual ~Clock() = default;
  virtual Date now() const = 0;
};

class Sleeper {
 public:
  virtual ~Sleeper() = default;
  virtual void sleepFor(Seconds duration) = 0;
};

Clock& currentClock();
Sleeper& currentSleeper();

// Installs a replacement for the whole process; nullptr restores the system
// clock or sleeper. The caller keeps ownership and must outlive its use.
void installClock(Clock* clock);
void installSleeper(Sleeper* sleeper);

}  // namespace vtc
