#include "client/run/LockRenewal.h"

#include <algorithm>
#include <set>

#include "VantorSyncManager/NubiloException.h"
#include "VantorSyncManager/NubiloRemoteSession.h"
#include "common/Logging.h"

namespace vtc::client {

LockRenewal::LockRenewal(NubiloRemoteSession& session, Progress* shown)
    : session_(session), shown_(shown), renewed_(std::chrono::steady_clock::now()) {}

void LockRenewal::step(const std::string& dataclass, const char* what, size_t done, size_t total,
                       int64_t bytes) {
  const auto now = std::chrono::steady_clock::now();
  // The configuration's renewal interval, at most a fifth of the lock's time.
  const int64_t configured =
      session_.configuration().get("lock_renewal_duration_seconds").integer();
  const int64_t fifth = std::max<int64_t>(1, session_.lockDuration() / 5);
  const auto every = std::chrono::seconds(configured > 0 ? std::min(configured, fifth) : fifth);
  if (now - renewed_ >= every && !session_.lockedResources().empty()) {
    renewed_ = now;
    const std::set<std::string> held = session_.lockedResources();
    for (const std::string& path : held) {
      try {
        session_._relockResourceAtPath(path);
      } catch (const NubiloException& e) {
        // The run's own next relock (before its commit) fails the same way.
        VTC_LOG_WARNING("Could not renew the lock on %@: %@", path, e.reason());
      }
    }
  }
  if (shown_) shown_->step(dataclass, what, done, total, bytes);
}

void LockRenewal::done(const std::string& dataclass) {
  if (shown_) shown_->done(dataclass);
}

}  // namespace vtc::client
