// A deadline for each whole request of a neon session. neon's read time-out
// starts again with every byte, so a server that answers one byte at a time
// would hold a request for ever; here, when a request's time is up, the
// session's socket is shut down (from a timer signal aimed at the calling
// thread), neon's read fails at once, and the connection is closed. The
// library starts no thread for it.
//
// The socket is the one neon opens: noted when a connection is made (the
// socket that appeared while neon connected to the address it names).
// Not thread-safe: one thread drives a session, as neon requires.
#pragma once

#include <ne_session.h>

#include <atomic>
#include <csignal>
#include <functional>

namespace vtc {

class RequestDeadline {
 public:
  // Watches the connections of session (its notifier is taken).
  explicit RequestDeadline(ne_session* session);
  ~RequestDeadline();
  RequestDeadline(const RequestDeadline&) = delete;
  RequestDeadline& operator=(const RequestDeadline&) = delete;

  // Runs request (which dispatches through the session and returns neon's
  // result) within seconds (0: no deadline). True when the time ran out:
  // the request then failed and the connection is closed.
  bool run(int seconds, const std::function<int()>& request, int& result);

  // What the signal handler reads; public for it alone.
  struct Watch {
    std::atomic<int> socket{-1};
    volatile sig_atomic_t passed = 0;
  };

 private:
  static void onStatus(void* userdata, ne_session_status status,
                       const ne_session_status_info* info);

  ne_session* session_;
  Watch watch_;
  // Socket inodes open when neon began to connect, and the peer it tried.
  std::function<bool(int)> isNew_;
};

}  // namespace vtc
