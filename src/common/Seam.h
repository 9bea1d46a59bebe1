// A process-wide replaceable function: where a platform component can be
// stood in for (by a test, or by a later subsystem), it is called through one
// of these. An empty function means "use the default".
#pragma once

#include <functional>
#include <mutex>
#include <utility>

namespace vtc {

template <typename Signature>
class Seam {
 public:
  void install(std::function<Signature> f) {
    std::lock_guard<std::mutex> lock(mutex_);
    f_ = std::move(f);
  }
  // A copy, so that a call runs outside the lock.
  std::function<Signature> current() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return f_;
  }

 private:
  mutable std::mutex mutex_;
  std::function<Signature> f_;
};

}  // namespace vtc
