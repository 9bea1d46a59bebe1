// A sleeper that records what it was asked to sleep and a clock that the
// sleeps advance, so protocol waits are asserted instead of waited for.
#pragma once

#include <mutex>
#include <vector>

#include "common/Clock.h"

namespace vtc::test {

class FakeTime final : public Clock, public Sleeper {
 public:
  FakeTime();  // installs itself as the process clock and sleeper
  ~FakeTime() override;

  Date now() const override;
  void sleepFor(Seconds duration) override;
  void advance(Seconds duration);
  // Every later reading of the clock moves it on by this much first, as if
  // each step of a long loop took that long.
  void advanceOnEveryReading(Seconds step);
  std::vector<double> sleeps() const;

 private:
  mutable std::mutex mutex_;
  mutable Date now_;
  Seconds step_{0};
  std::vector<double> sleeps_;
};

}  // namespace vtc::test
