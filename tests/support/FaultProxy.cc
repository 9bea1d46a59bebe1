#include "support/FaultProxy.h"

#include <chrono>

#include <poll.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <sstream>

#include "localshare/Processes.h"
#include "platform/dav/DavPaths.h"

namespace vtc::test {

using local::connectLoopback;
using local::listenLoopback;

namespace {

std::string answerWith(int status) {
  std::string response = "HTTP/1.1 " + std::to_string(status) + " Injected\r\n";
  if (status == 401) response += "WWW-Authenticate: Basic realm=\"Tessel\"\r\n";
  return response + "Content-Length: 0\r\n\r\n";
}

}  // namespace

FaultProxy::FaultProxy(int targetPort)
    : targetPort_(targetPort), listener_(listenLoopback(port_)), wake_(::eventfd(0, EFD_CLOEXEC)) {
  acceptor_ = std::thread([this] {
    for (;;) {
      pollfd fds[2] = {{listener_, POLLIN, 0}, {wake_, POLLIN, 0}};
      if (::poll(fds, 2, -1) < 0 || fds[1].revents) return;
      int client = ::accept4(listener_, nullptr, nullptr, SOCK_CLOEXEC);
      if (client < 0) continue;
      std::lock_guard<std::mutex> lock(mutex_);
      connections_.emplace_back([this, client] { serve(client); });
    }
  });
}

FaultProxy::~FaultProxy() {
  (void)!::eventfd_write(wake_, 1);
  acceptor_.join();
  for (auto& t : connections_) t.join();  // the acceptor adds no more
  ::close(listener_);
  ::close(wake_);
}

void FaultProxy::add(Rule rule) {
  std::lock_guard<std::mutex> lock(mutex_);
  rules_.push_back(std::move(rule));
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

FaultProxy::Rule FaultProxy::decide(const std::string& request) {
  std::string method, target;
  std::istringstream(request) >> method >> target;
  std::string path = davpath::fromHref(target.substr(0, target.find('?')));
  std::lock_guard<std::mutex> lock(mutex_);
  Rule chosen;
  for (Rule& rule : rules_) {
    if (!rule.match.after.empty() && !rule.counting) {
      rule.counting = rule.match.after == method;
      continue;
    }
    if (!rule.match.method.empty() && rule.match.method != method) continue;
    if (!rule.match.path.empty() && davpath::canonical(rule.match.path) != davpath::canonical(path))
      continue;
    ++rule.seen;
    if (rule.match.occurrence == 0 || rule.match.occurrence == rule.seen) {
      chosen = rule;
      break;
    }
  }
  seen_.push_back({method, path, chosen.action});
  return chosen;
}

void FaultProxy::serve(int client) {
  int server = connectLoopback(targetPort_);
  std::string pending;
  bool swallowing = false;  // after a time-out nothing more is forwarded
  bool deaf = false;        // after a lost answer nothing more reaches the client
  bool open = server >= 0;
  char buf[65536];
  while (open) {
    pollfd fds[3] = {{client, POLLIN, 0}, {server, POLLIN, 0}, {wake_, POLLIN, 0}};
    if (::poll(fds, 3, -1) < 0 || fds[2].revents) break;
    if ((fds[0].revents | fds[1].revents) & (POLLERR | POLLNVAL)) break;  // a broken socket
    if (fds[1].revents & (POLLIN | POLLHUP)) {
      ssize_t n = ::recv(server, buf, sizeof buf, 0);
      if (n <= 0 || (!deaf && !sendAll(client, {buf, static_cast<size_t>(n)}))) break;
    }
    if (fds[0].revents & (POLLIN | POLLHUP)) {
      ssize_t n = ::recv(client, buf, sizeof buf, 0);
      if (n <= 0) break;
      if (!swallowing) pending.append(buf, static_cast<size_t>(n));
      while (open && !swallowing) {
        size_t length = httpRequestLength(pending);
        if (length == 0) break;
        Rule rule = decide(pending);
        if (rule.answer)
          open = sendAnswer(client, *rule.answer, wake_) &&
                 rule.answer->head.find("Content-Length:") != std::string::npos;
        else if (rule.action == "timed out")
          swallowing = true;
        else if (rule.action == "answer lost") {
          open = sendAll(server, std::string_view(pending).substr(0, length));
          swallowing = deaf = true;
        } else if (rule.action == "dropped")
          open = false;
        else if (rule.status != 0)
          open = sendAll(client, answerWith(rule.status));
        else if (rule.action == "delayed") {
          std::this_thread::sleep_for(std::chrono::milliseconds(rule.delayMs));
          open = sendAll(server, std::string_view(pending).substr(0, length));
        } else
          open = sendAll(server, std::string_view(pending).substr(0, length));
        pending.erase(0, length);
      }
    }
  }
  if (server >= 0) ::close(server);
  ::shutdown(client, SHUT_RDWR);
  ::close(client);
}

}  // namespace vtc::test
