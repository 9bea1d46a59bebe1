// The one process that syncs: ".owner.pid" in the support folder holds its
// process number, under an exclusive lock for the whole run, so that runs
// never overlap and other programs can ask whether a sync runs.
#pragma once

#include <memory>

namespace vtc::client {

class SyncOwner {
 public:
  // Takes ownership, or raises SyncFailure (Busy) naming the process that
  // holds it.
  static std::unique_ptr<SyncOwner> acquire();
  // Empties the file and gives up the lock.
  ~SyncOwner();
  SyncOwner(const SyncOwner&) = delete;
  SyncOwner& operator=(const SyncOwner&) = delete;

 private:
  explicit SyncOwner(int fd) : fd_(fd) {}
  int fd_;
};

}  // namespace vtc::client
