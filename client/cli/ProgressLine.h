// The progress of a sync on a terminal: one line, redrawn in place at most
// ten times a second, with the counts, the bytes and the time left.
#pragma once

#include <chrono>
#include <cstdio>
#include <string>

#include "client/run/Progress.h"

namespace vtc::client {

class ProgressLine : public Progress {
 public:
  explicit ProgressLine(std::FILE* terminal) : terminal_(terminal) {}
  ~ProgressLine() override { clear(); }

  void step(const std::string& dataclass, const char* what, size_t done, size_t total,
            int64_t bytes) override;
  void done(const std::string& dataclass) override;

 private:
  using Clock = std::chrono::steady_clock;
  void clear();

  std::FILE* terminal_;
  std::string step_;  // dataclass and what, of the step being drawn
  Clock::time_point stepStarted_{};
  Clock::time_point lastDrawn_{};
  bool drawn_ = false;
};

}  // namespace vtc::client
