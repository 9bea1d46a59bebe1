// A fault-injecting HTTP proxy between the library and a server on
// 127.0.0.1. It forwards everything byte for byte, except requests that a
// rule matches: those time out (swallowed, never answered), lose their
// connection, get an answer of the test's choosing (a status, or any bytes
// at any pace: HostileServer.h), or reach the server with its answer lost
// on the way back. Requests are matched by method and unescaped path, on
// every occurrence or only the nth, counted from the start or from the
// first request of another method.
// Rules and records may be touched from any thread while the proxy serves.
#pragma once

#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "support/HostileServer.h"

namespace vtc::test {

struct Match {
  Match(std::string m = {}, std::string p = {}, int n = 0, std::string a = {})
      : method(std::move(m)), path(std::move(p)), occurrence(n), after(std::move(a)) {}
  std::string method;  // empty: any method
  std::string path;    // empty: any path; else the unescaped path (a trailing "/" is ignored)
  int occurrence = 0;  // 0: every matching request; n: only the nth (1-based)
  std::string after;   // non-empty: counting starts after the first request of this method
};

class FaultProxy {
 public:
  struct Seen {
    std::string method;
    std::string path;
    // "forwarded", "timed out", "dropped", "delayed", "answer lost" or "answered <status>"
    std::string action;
  };

  explicit FaultProxy(int targetPort);
  ~FaultProxy();
  FaultProxy(const FaultProxy&) = delete;
  FaultProxy& operator=(const FaultProxy&) = delete;

  int port() const { return port_; }

  void timeOut(Match match) { add({std::move(match), "timed out", 0, 0, 0, nullptr, false}); }
  void dropConnection(Match match) { add({std::move(match), "dropped", 0, 0, 0, nullptr, false}); }
  // Forwards the request, so that the server carries it out, and swallows
  // its answer and everything after it, as a client killed before it read
  // the answer.
  void loseAnswer(Match match) { add({std::move(match), "answer lost", 0, 0, 0, nullptr, false}); }
  // Answers with this status and no body instead of forwarding; a 401
  // carries a Basic challenge.
  void answer(Match match, int status) {
    add({std::move(match), "answered " + std::to_string(status), status, 0, 0, nullptr, false});
  }
  // Answers with exactly these bytes instead of forwarding.
  void respond(Match match, HostileAnswer answer) {
    add({std::move(match), "answered by the test", 0, 0, 0,
         std::make_shared<HostileAnswer>(std::move(answer)), false});
  }
  // Holds the request this long, then forwards it.
  void delay(Match match, int milliseconds) {
    add({std::move(match), "delayed", 0, 0, milliseconds, nullptr, false});
  }
  void clear();

  std::vector<Seen> requests() const;
  // How many requests of this method (any path) were seen.
  size_t count(const std::string& method) const;

 private:
  struct Rule {
    Match match;
    std::string action = "forwarded";
    int status = 0;  // of an answer
    int seen = 0;    // matching requests so far
    int delayMs = 0;
    std::shared_ptr<const HostileAnswer> answer;
    bool counting = false;  // the request named by match.after was seen
  };

  void add(Rule rule);
  // The rule that applies to the request at the start of pending (a
  // forwarding one if none does).
  Rule decide(const std::string& pending);
  void serve(int client);

  int targetPort_;
  int port_ = 0;
  int listener_ = -1;
  int wake_ = -1;  // readable once the proxy stops; every poll() watches it
  mutable std::mutex mutex_;
  std::vector<Rule> rules_;
  std::vector<Seen> seen_;
  std::vector<std::thread> connections_;
  std::thread acceptor_;
};

}  // namespace vtc::test
