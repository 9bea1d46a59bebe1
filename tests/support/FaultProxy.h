// A fault-injecting HTTP proxy between the library and a server on
// 127.0.0.1. It forwards everything byte for byte, except requests that a
// rule matches: those time out (swallowed, never answered), lose their
// connection, or get an answer of the test's choosing. Requests are matched
// by method and unescaped path, on every occurrence or only the nth.
// Rules and records may be touched from any thread while the proxy serves.
#pragma once

#include <atomic>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

namespace vtc::test {

struct Match {
  std::string method;  // empty: any method
  std::string path;    // empty: any path; else the unescaped path (a trailing "/" is ignored)
  int occurrence = 0;  // 0: every matching request; n: only the nth (1-based)
};

class FaultProxy {
 public:
  struct Seen {
    std::string method;
    std::string path;
    std::string action;  // "forwarded", "timed out", "dropped" or "answered <status>"
  };

  explicit FaultProxy(int targetPort);
  ~FaultProxy();
  FaultProxy(const FaultProxy&) = delete;
  FaultProxy& operator=(const FaultProxy&) = delete;

  int port() const { return port_; }

  void timeOut(Match match);
  void dropConnection(Match match);
  // Answers with this status and body instead of forwarding; a 401 carries a
  // Basic challenge, a body that starts with "<?xml" is sent as XML.
  void answer(Match match, int status, std::string body = {});
  void clear();

  std::vector<Seen> requests() const;
  // How many requests of this method (any path) were seen.
  size_t count(const std::string& method) const;

 private:
  enum class Action { Forward, TimeOut, Drop, Answer };
  struct Rule {
    Match match;
    Action action;
    int status = 0;
    std::string body;
    int seen = 0;
  };
  struct Decision {
    Action action = Action::Forward;
    int status = 0;
    std::string body;
  };

  void acceptLoop();
  void serve(int client);
  Decision decide(const std::string& method, const std::string& path);

  int targetPort_;
  int port_ = 0;
  int listener_ = -1;
  int wake_[2] = {-1, -1};
  std::atomic<bool> stopping_{false};
  mutable std::mutex mutex_;
  std::vector<Rule> rules_;
  std::vector<Seen> seen_;
  std::vector<std::thread> connections_;
  std::thread acceptor_;
};

}  // namespace vtc::test
