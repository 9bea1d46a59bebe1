#include "support/HostileServer.h"

#include <poll.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <sstream>

#include "localshare/Processes.h"
#include "platform/dav/DavPaths.h"

namespace vtc::test {

HostileAnswer HostileAnswer::with(int status, std::string contentType, std::string body,
                                  uint64_t repeat, bool announced) {
  HostileAnswer a;
  a.head =
      "HTTP/1.1 " + std::to_string(status) + " Chosen\r\nContent-Type: " + contentType + "\r\n";
  a.head += announced ? "Content-Length: " + std::to_string(body.size() * repeat) + "\r\n"
                      : "Connection: close\r\n";
  a.head += "\r\n";
  a.body = std::move(body);
  a.repeat = repeat;
  return a;
}

size_t httpRequestLength(const std::string& buffered) {
  const size_t headEnd = buffered.find("\r\n\r\n");
  if (headEnd == std::string::npos) return 0;
  const std::string head = buffered.substr(0, headEnd + 2);
  const char* length = ::strcasestr(head.c_str(), "\r\ncontent-length:");
  const size_t total = headEnd + 4 + (length ? std::strtoul(length + 17, nullptr, 10) : 0);
  return buffered.size() < total ? 0 : total;
}

bool sendAll(int fd, std::string_view data, int wake) {
  while (!data.empty()) {
    pollfd fds[2] = {{fd, POLLOUT, 0}, {wake, POLLIN, 0}};
    if (::poll(fds, wake >= 0 ? 2 : 1, -1) < 0 || (wake >= 0 && fds[1].revents)) return false;
    const ssize_t n = ::send(fd, data.data(), data.size(), MSG_NOSIGNAL);
    if (n <= 0) return false;
    data.remove_prefix(static_cast<size_t>(n));
  }
  return true;
}

bool sendAnswer(int fd, const HostileAnswer& answer, int wake) {
  auto emit = [&](std::string_view data) {
    if (answer.piece == 0) return sendAll(fd, data, wake);
    for (size_t at = 0; at < data.size(); at += answer.piece) {
      if (!sendAll(fd, data.substr(at, answer.piece), wake)) return false;
      pollfd w{wake, POLLIN, 0};
      if (::poll(&w, wake >= 0 ? 1 : 0, static_cast<int>(answer.pause.count())) != 0)
        return false;  // stopping
    }
    return true;
  };
  if (!emit(answer.head)) return false;
  for (uint64_t i = 0; i < answer.repeat; ++i)
    if (!emit(answer.body)) return false;
  return true;
}

HostileServer::HostileServer(Answerer answerer)
    : answerer_(std::move(answerer)),
      listener_(local::listenLoopback(port_)),
      wake_(::eventfd(0, EFD_CLOEXEC)) {
  acceptor_ = std::thread([this] {
    for (;;) {
      pollfd fds[2] = {{listener_, POLLIN, 0}, {wake_, POLLIN, 0}};
      if (::poll(fds, 2, -1) < 0 || fds[1].revents) return;
      const int client = ::accept4(listener_, nullptr, nullptr, SOCK_CLOEXEC);
      if (client < 0) continue;
      std::lock_guard<std::mutex> lock(mutex_);
      connections_.emplace_back([this, client] { serve(client); });
    }
  });
}

HostileServer::~HostileServer() {
  (void)!::eventfd_write(wake_, 1);
  acceptor_.join();
  for (auto& t : connections_) t.join();  // the acceptor adds no more
  ::close(listener_);
  ::close(wake_);
}

std::vector<HostileRequest> HostileServer::requests() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return requests_;
}

void HostileServer::serve(int client) {
  std::string pending;
  char buf[65536];
  for (bool open = true; open;) {
    pollfd fds[2] = {{client, POLLIN, 0}, {wake_, POLLIN, 0}};
    if (::poll(fds, 2, -1) < 0 || fds[1].revents) break;
    const ssize_t n = ::recv(client, buf, sizeof buf, 0);
    if (n <= 0) break;
    pending.append(buf, static_cast<size_t>(n));
    while (open) {
      const size_t length = httpRequestLength(pending);
      if (length == 0) break;
      HostileRequest request;
      std::string target;
      std::istringstream(pending) >> request.method >> target;
      request.path = davpath::fromHref(target.substr(0, target.find('?')));
      pending.erase(0, length);
      {
        std::lock_guard<std::mutex> lock(mutex_);
        requests_.push_back(request);
      }
      const HostileAnswer answer = answerer_(request);
      // An answer without a length ends with the connection.
      open = sendAnswer(client, answer, wake_) &&
             answer.head.find("Content-Length:") != std::string::npos;
    }
  }
  ::shutdown(client, SHUT_RDWR);
  ::close(client);
}

}  // namespace vtc::test
