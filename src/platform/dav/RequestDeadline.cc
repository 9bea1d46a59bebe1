#include "platform/dav/RequestDeadline.h"

#include <dirent.h>
#include <netinet/in.h>
#include <pthread.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <time.h>
#include <unistd.h>

#include <cstring>
#include <set>
#include <utility>
#include <vector>

#include <ne_socket.h>

#include "common/Logging.h"

namespace vtc {

namespace {

// A real-time signal of the library's own; a program that has a handler of
// its own for it keeps it, and its requests keep only neon's time-outs.
const int kSignal = SIGRTMIN + 5;

void onDeadline(int, siginfo_t* info, void*) {
  auto* watch = static_cast<RequestDeadline::Watch*>(info->si_value.sival_ptr);
  if (!watch) return;
  watch->passed = 1;
  const int fd = watch->socket.load();
  if (fd >= 0) ::shutdown(fd, SHUT_RDWR);  // async-signal-safe
}

bool signalReady() {
  static const bool ready = [] {
    struct sigaction current {};
    if (::sigaction(kSignal, nullptr, &current) != 0) return false;
    if (!(current.sa_flags & SA_SIGINFO) && current.sa_handler != SIG_DFL) {
      VTC_LOG_WARNING(
          "Signal %d has a handler already: requests have no deadline for their whole "
          "answer, only neon's time-out between bytes",
          kSignal);
      return false;
    }
    struct sigaction ours {};
    ours.sa_sigaction = onDeadline;
    ours.sa_flags = SA_SIGINFO;
    sigemptyset(&ours.sa_mask);
    return ::sigaction(kSignal, &ours, nullptr) == 0;
  }();
  return ready;
}

// The process's open sockets: descriptor and inode.
std::set<std::pair<int, ino_t>> openSockets() {
  std::set<std::pair<int, ino_t>> out;
  DIR* dir = ::opendir("/proc/self/fd");
  if (!dir) return out;
  while (const dirent* e = ::readdir(dir)) {
    const int fd = std::atoi(e->d_name);
    struct stat st {};
    if (e->d_name[0] != '.' && ::fstat(fd, &st) == 0 && S_ISSOCK(st.st_mode))
      out.emplace(fd, st.st_ino);
  }
  ::closedir(dir);
  return out;
}

// Whether the socket is connected to the raw address (4 or 16 bytes).
bool connectedTo(int fd, const std::vector<unsigned char>& address) {
  sockaddr_storage peer{};
  socklen_t length = sizeof peer;
  if (::getpeername(fd, reinterpret_cast<sockaddr*>(&peer), &length) != 0) return false;
  if (peer.ss_family == AF_INET && address.size() == 4)
    return std::memcmp(&reinterpret_cast<sockaddr_in&>(peer).sin_addr, address.data(), 4) == 0;
  if (peer.ss_family == AF_INET6 && address.size() == 16)
    return std::memcmp(&reinterpret_cast<sockaddr_in6&>(peer).sin6_addr, address.data(), 16) == 0;
  return false;
}

}  // namespace

RequestDeadline::RequestDeadline(ne_session* session) : session_(session) {
  ne_set_notifier(session_, &RequestDeadline::onStatus, this);
}

RequestDeadline::~RequestDeadline() {
  ne_set_notifier(session_, nullptr, nullptr);
}

void RequestDeadline::onStatus(void* userdata, ne_session_status status,
                               const ne_session_status_info* info) {
  auto* self = static_cast<RequestDeadline*>(userdata);
  switch (status) {
    case ne_status_connecting: {
      std::vector<unsigned char> address;
      if (info && info->ci.address) {
        unsigned char raw[16];
        ne_iaddr_raw(info->ci.address, raw);
        address.assign(raw, raw + (ne_iaddr_typeof(info->ci.address) == ne_iaddr_ipv6 ? 16 : 4));
      }
      self->isNew_ = [before = openSockets(), address](int fd) {
        struct stat st {};
        return ::fstat(fd, &st) == 0 && !before.contains({fd, st.st_ino}) &&
               connectedTo(fd, address);
      };
      break;
    }
    case ne_status_connected:
      if (self->isNew_)
        for (const auto& [fd, inode] : openSockets())
          if (self->isNew_(fd)) {
            self->watch_.socket = fd;
            break;
          }
      // A request whose time ran out while neon connected anew gets no
      // further with the new connection.
      if (self->watch_.passed && self->watch_.socket >= 0)
        ::shutdown(self->watch_.socket, SHUT_RDWR);
      break;
    case ne_status_disconnected:
      self->watch_.socket = -1;
      break;
    default:
      break;
  }
}

bool RequestDeadline::run(int seconds, const std::function<int()>& request, int& result) {
  watch_.passed = 0;
  timer_t timer{};
  sigevent event{};
  event.sigev_notify = SIGEV_THREAD_ID;
  event.sigev_signo = kSignal;
  event.sigev_value.sival_ptr = &watch_;
  event._sigev_un._tid = ::gettid();
  if (seconds <= 0 || !signalReady() || ::timer_create(CLOCK_MONOTONIC, &event, &timer) != 0) {
    result = request();
    return false;
  }
  itimerspec when{};
  when.it_value.tv_sec = seconds;
  ::timer_settime(timer, 0, &when, nullptr);
  // The signal must reach this thread even where the program blocks it.
  sigset_t only, before;
  sigemptyset(&only);
  sigaddset(&only, kSignal);
  ::pthread_sigmask(SIG_UNBLOCK, &only, &before);
  result = request();
  ::timer_delete(timer);  // a signal still pending from it goes too
  ::pthread_sigmask(SIG_SETMASK, &before, nullptr);
  if (!watch_.passed) return false;
  ne_close_connection(session_);
  watch_.socket = -1;
  return true;
}

}  // namespace vtc
