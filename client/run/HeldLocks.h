// The server locks a run holds, recorded in the support folder while it
// holds them, so that the next run gives back the locks of a run that was
// killed instead of waiting for them to expire.
#pragma once

#include <string>

class NubiloRemoteSession;

namespace vtc::client {

class HeldLocks {
 public:
  explicit HeldLocks(NubiloRemoteSession& session);
  // Gives back every lock a previous run left recorded.
  void releaseLeftovers();
  // Records the session's current locks (after a lock, relock or unlock).
  void record();
  // Forgets the record (after the run's last unlock).
  void clear();

 private:
  NubiloRemoteSession& session_;
  std::string file_;
};

}  // namespace vtc::client
