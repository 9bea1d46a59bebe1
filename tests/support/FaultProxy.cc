#include "support/FaultProxy.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <optional>
#include <stdexcept>

#include "platform/dav/DavPaths.h"

namespace vtc::test {

namespace {

int connectTo(int port) {
  int fd = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_in addr{};
  addr.sin_family = AF_INET;
  addr.sin_port = htons(static_cast<uint16_t>(port));
  addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  if (::connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) != 0) {
    ::close(fd);
    return -1;
  }
  return fd;
}

bool writeAll(int fd, const char* data, size_t len) {
  while (len > 0) {
    ssize_t n = ::send(fd, data, len, MSG_NOSIGNAL);
    if (n <= 0) return false;
    data += n;
    len -= static_cast<size_t>(n);
  }
  return true;
}

std::string lower(std::string s) {
  for (char& c : s) c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
  return s;
}

struct Request {
  std::string method;
  std::string path;
  size_t length = 0;  // bytes of head and body in the buffer
};

// The length of a chunked body starting at `from`, or nullopt if incomplete.
std::optional<size_t> chunkedLength(const std::string& buf, size_t from) {
  size_t pos = from;
  for (;;) {
    size_t eol = buf.find("\r\n", pos);
    if (eol == std::string::npos) return std::nullopt;
    size_t size = std::strtoul(buf.c_str() + pos, nullptr, 16);
    pos = eol + 2;
    if (size == 0) {
      size_t end = buf.find("\r\n", pos);  // trailers end with an empty line
      while (end != std::string::npos && end != pos) {
        pos = end + 2;
        end = buf.find("\r\n", pos);
      }
      if (end == std::string::npos) return std::nullopt;
      return end + 2 - from;
    }
    if (buf.size() < pos + size + 2) return std::nullopt;
    pos += size + 2;
  }
}

// The first whole request in buf, if there is one.
std::optional<Request> nextRequest(const std::string& buf) {
  size_t headEnd = buf.find("\r\n\r\n");
  if (headEnd == std::string::npos) return std::nullopt;
  Request r;
  size_t sp1 = buf.find(' ');
  size_t sp2 = buf.find(' ', sp1 + 1);
  r.method = buf.substr(0, sp1);
  std::string target = buf.substr(sp1 + 1, sp2 - sp1 - 1);
  if (size_t q = target.find('?'); q != std::string::npos) target.resize(q);
  r.path = davpath::fromHref(target);
  size_t bodyStart = headEnd + 4;
  std::string head = lower(buf.substr(0, headEnd + 2));
  size_t bodyLength = 0;
  if (head.find("\r\ntransfer-encoding: chunked") != std::string::npos) {
    auto n = chunkedLength(buf, bodyStart);
    if (!n) return std::nullopt;
    bodyLength = *n;
  } else if (size_t cl = head.find("\r\ncontent-length:"); cl != std::string::npos) {
    bodyLength = std::strtoul(head.c_str() + cl + 17, nullptr, 10);
  }
  if (buf.size() < bodyStart + bodyLength) return std::nullopt;
  r.length = bodyStart + bodyLength;
  return r;
}

const char* reasonPhrase(int status) {
  switch (status) {
    case 401:
      return "Unauthorized";
    case 402:
      return "Payment Required";
    case 404:
      return "Not Found";
    case 412:
      return "Precondition Failed";
    case 423:
      return "Locked";
    case 500:
      return "Internal Server Error";
    case 503:
      return "Service Unavailable";
    case 507:
      return "Insufficient Storage";
    case 508:
      return "Loop Detected";
    default:
      return "Status";
  }
}

bool samePath(const std::string& a, const std::string& b) {
  return davpath::canonical(a) == davpath::canonical(b);
}

}  // namespace

FaultProxy::FaultProxy(int targetPort) : targetPort_(targetPort) {
  listener_ = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_in addr{};
  addr.sin_family = AF_INET;
  addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  socklen_t len = sizeof addr;
  if (::bind(listener_, reinterpret_cast<sockaddr*>(&addr), sizeof addr) != 0 ||
      ::listen(listener_, 16) != 0 ||
      ::getsockname(listener_, reinterpret_cast<sockaddr*>(&addr), &len) != 0 ||
      ::pipe2(wake_, O_CLOEXEC) != 0)
    throw std::runtime_error("fault proxy: cannot listen");
  port_ = ntohs(addr.sin_port);
  acceptor_ = std::thread([this] { acceptLoop(); });
}

FaultProxy::~FaultProxy() {
  stopping_ = true;
  (void)!::write(wake_[1], "x", 1);  // every poll() also watches the wake pipe
  acceptor_.join();
  std::vector<std::thread> threads;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    threads.swap(connections_);
  }
  for (auto& t : threads) t.join();
  ::close(listener_);
  ::close(wake_[0]);
  ::close(wake_[1]);
}

void FaultProxy::timeOut(Match match) {
  std::lock_guard<std::mutex> lock(mutex_);
  rules_.push_back({std::move(match), Action::TimeOut, 0, {}, 0});
}

void FaultProxy::dropConnection(Match match) {
  std::lock_guard<std::mutex> lock(mutex_);
  rules_.push_back({std::move(match), Action::Drop, 0, {}, 0});
}

void FaultProxy::answer(Match match, int status, std::string body) {
  std::lock_guard<std::mutex> lock(mutex_);
  rules_.push_back({std::move(match), Action::Answer, status, std::move(body), 0});
}

void FaultProxy::clear() {
  std::lock_guard<std::mutex> lock(mutex_);
  rules_.clear();
}

std::vector<FaultProxy::Seen> FaultProxy::requests() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return seen_;
}

size_t FaultProxy::count(const std::string& method) const {
  auto all = requests();
  return std::count_if(all.begin(), all.end(), [&](const Seen& s) { return s.method == method; });
}

FaultProxy::Decision FaultProxy::decide(const std::string& method, const std::string& path) {
  std::lock_guard<std::mutex> lock(mutex_);
  Decision d;
  for (Rule& rule : rules_) {
    if (!rule.match.method.empty() && rule.match.method != method) continue;
    if (!rule.match.path.empty() && !samePath(rule.match.path, path)) continue;
    ++rule.seen;
    if (rule.match.occurrence != 0 && rule.match.occurrence != rule.seen) continue;
    d = {rule.action, rule.status, rule.body};
    break;
  }
  const char* names[] = {"forwarded", "timed out", "dropped", "answered"};
  std::string action = names[static_cast<int>(d.action)];
  if (d.action == Action::Answer) {
    action += ' ';
    action += std::to_string(d.status);
  }
  seen_.push_back({method, path, action});
  return d;
}

void FaultProxy::acceptLoop() {
  for (;;) {
    pollfd fds[2] = {{listener_, POLLIN, 0}, {wake_[0], POLLIN, 0}};
    if (::poll(fds, 2, -1) < 0 || stopping_) return;
    if (!(fds[0].revents & POLLIN)) continue;
    int client = ::accept4(listener_, nullptr, nullptr, SOCK_CLOEXEC);
    if (client < 0) continue;
    std::lock_guard<std::mutex> lock(mutex_);
    connections_.emplace_back([this, client] { serve(client); });
  }
}

void FaultProxy::serve(int client) {
  int server = connectTo(targetPort_);
  std::string pending;
  bool swallowing = false;  // after a time-out nothing more is forwarded
  char buf[65536];
  while (server >= 0 && !stopping_) {
    pollfd fds[3] = {{client, POLLIN, 0}, {server, POLLIN, 0}, {wake_[0], POLLIN, 0}};
    if (::poll(fds, 3, -1) < 0 || stopping_) break;
    if ((fds[0].revents | fds[1].revents) & (POLLERR | POLLNVAL)) break;  // a broken socket
    if (fds[1].revents & (POLLIN | POLLHUP)) {
      ssize_t n = ::recv(server, buf, sizeof buf, 0);
      if (n <= 0 || !writeAll(client, buf, static_cast<size_t>(n))) break;
    }
    if (fds[0].revents & (POLLIN | POLLHUP)) {
      ssize_t n = ::recv(client, buf, sizeof buf, 0);
      if (n <= 0) break;
      if (swallowing) continue;
      pending.append(buf, static_cast<size_t>(n));
      bool open = true;
      while (open) {
        std::optional<Request> r = nextRequest(pending);
        if (!r) break;
        Decision d = decide(r->method, r->path);
        if (d.action == Action::Forward) {
          open = writeAll(server, pending.data(), r->length);
        } else if (d.action == Action::Drop) {
          open = false;
        } else if (d.action == Action::TimeOut) {
          swallowing = true;
          pending.clear();
          break;
        } else {
          std::string response = "HTTP/1.1 " + std::to_string(d.status) + " " +
                                 reasonPhrase(d.status) +
                                 "\r\nContent-Length: " + std::to_string(d.body.size()) + "\r\n";
          if (d.status == 401) response += "WWW-Authenticate: Basic realm=\"Tessel\"\r\n";
          response += d.body.starts_with("<?xml") ? "Content-Type: application/xml\r\n"
                                                  : "Content-Type: text/plain\r\n";
          // A HEAD answer has headers only: a body would be read as the next answer.
          response += "\r\n" + (r->method == "HEAD" ? std::string() : d.body);
          open = writeAll(client, response.data(), response.size());
        }
        if (open) pending.erase(0, r->length);
      }
      if (!open) break;
    }
  }
  if (server >= 0) ::close(server);
  ::shutdown(client, SHUT_RDWR);
  ::close(client);
}

}  // namespace vtc::test
