// Keeps a run's locks renewed while it works: at each step of the progress
// it reports (between requests, never inside one), the locks the session
// holds are renewed once the configuration's renewal interval (at most a
// fifth of their duration) has passed since the last renewal, so that another computer can tell a
// lock that nobody renews any more (ForeignLocks.h) from one whose run is still under way.
#pragma once

#include <chrono>

#include "client/run/Progress.h"

class NubiloRemoteSession;

namespace vtc::client {

class LockRenewal : public Progress {
 public:
  // shown: the progress to pass every step on to (none: no terminal).
  LockRenewal(NubiloRemoteSession& session, Progress* shown);

  void step(const std::string& dataclass, const char* what, size_t done, size_t total,
            int64_t bytes) override;
  void done(const std::string& dataclass) override;

 private:
  NubiloRemoteSession& session_;
  Progress* shown_;
  std::chrono::steady_clock::time_point renewed_;
};

}  // namespace vtc::client
