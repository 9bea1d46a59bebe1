#include "platform/network/Reachability.h"

#include <fcntl.h>
#include <netdb.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstring>

namespace vtc::network {

namespace {

// One address: 0 when it connected, else the errno of the failure.
int tryConnect(const addrinfo& address, int milliseconds) {
  const int fd = ::socket(address.ai_family, address.ai_socktype | SOCK_NONBLOCK | SOCK_CLOEXEC,
                          address.ai_protocol);
  if (fd < 0) return errno;
  int error = 0;
  if (::connect(fd, address.ai_addr, address.ai_addrlen) != 0) {
    error = errno;
    if (error == EINPROGRESS) {
      pollfd p{fd, POLLOUT, 0};
      const int ready = ::poll(&p, 1, milliseconds);
      if (ready == 0) {
        error = ETIMEDOUT;
      } else {
        socklen_t length = sizeof error;
        if (ready < 0 || ::getsockopt(fd, SOL_SOCKET, SO_ERROR, &error, &length) != 0)
          error = errno;
      }
    }
  }
  ::close(fd);
  return error;
}

}  // namespace

std::optional<std::string> whyUnreachable(const std::string& host, int port, double seconds) {
  std::string name = host;
  if (name.size() > 2 && name.front() == '[' && name.back() == ']')
    name = name.substr(1, name.size() - 2);
  addrinfo hints{};
  hints.ai_family = AF_UNSPEC;
  hints.ai_socktype = SOCK_STREAM;
  addrinfo* found = nullptr;
  const int looked = ::getaddrinfo(name.c_str(), std::to_string(port).c_str(), &hints, &found);
  if (looked != 0) return looked == EAI_NONAME ? "no such host" : ::gai_strerror(looked);
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::duration<double>(seconds);
  int error = EHOSTUNREACH;
  for (const addrinfo* a = found; a; a = a->ai_next) {
    const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
        deadline - std::chrono::steady_clock::now());
    if (left.count() <= 0) break;
    error = tryConnect(*a, static_cast<int>(left.count()));
    if (error == 0) break;
  }
  ::freeaddrinfo(found);
  if (error == 0) return std::nullopt;
  if (error == ETIMEDOUT)
    return "no answer within " + std::to_string(static_cast<int>(seconds)) + " seconds";
  return std::string(std::strerror(error));
}

}  // namespace vtc::network
