#include "common/Clock.h"

#include <atomic>
#include <thread>

namespace vtc {

namespace {

class SystemClock final : public Clock {
 public:
  Date now() const override { return std::chrono::system_clock::now(); }
};

class SystemSleeper final : public Sleeper {
 public:
  void sleepFor(Seconds duration) override {
    if (duration.count() > 0) std::this_thread::sleep_for(duration);
  }
};

SystemClock gSystemClock;
SystemSleeper gSystemSleeper;
std::atomic<Clock*> gClock{&gSystemClock};
std::atomic<Sleeper*> gSleeper{&gSystemSleeper};

}  // namespace

Clock& currentClock() {
  return *gClock.load();
}
Sleeper& currentSleeper() {
  return *gSleeper.load();
}
void installClock(Clock* clock) {
  gClock.store(clock ? clock : &gSystemClock);
}
void installSleeper(Sleeper* sleeper) {
  gSleeper.store(sleeper ? sleeper : &gSystemSleeper);
}

}  // namespace vtc
