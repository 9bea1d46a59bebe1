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
  std::vector<double> sleeps() const;

 private:
  mutable std::mutex mutex_;
  Date now_;
  std::vector<double> sleeps_;
};

}  // namespace vtc::test
