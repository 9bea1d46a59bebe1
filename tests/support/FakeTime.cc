#include "support/FakeTime.h"

namespace vtc::test {

// Starts on a whole second, as dates in XML property lists are kept.
FakeTime::FakeTime()
    : now_(std::chrono::floor<std::chrono::seconds>(std::chrono::system_clock::now())) {
  installClock(this);
  installSleeper(this);
}

FakeTime::~FakeTime() {
  installClock(nullptr);
  installSleeper(nullptr);
}

Date FakeTime::now() const {
  std::lock_guard<std::mutex> lock(mutex_);
  now_ += std::chrono::duration_cast<Date::duration>(step_);
  return now_;
}

void FakeTime::advanceOnEveryReading(Seconds step) {
  std::lock_guard<std::mutex> lock(mutex_);
  step_ = step;
}

void FakeTime::sleepFor(Seconds duration) {
  advance(duration);
  std::lock_guard<std::mutex> lock(mutex_);
  sleeps_.push_back(duration.count());
}

void FakeTime::advance(Seconds duration) {
  std::lock_guard<std::mutex> lock(mutex_);
  now_ += std::chrono::duration_cast<Date::duration>(duration);
}

std::vector<double> FakeTime::sleeps() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return sleeps_;
}

}  // namespace vtc::test
