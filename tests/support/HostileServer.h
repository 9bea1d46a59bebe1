// A hostile server in miniature: a small HTTP server of our own on
// 127.0.0.1 that answers each request with exactly the bytes a test chooses
// (an answer that never ends, one byte at a time, a gigabyte of nothing,
// malformed XML), so that a test can tell what the client does with them.
// The same answers can be given by the fault proxy (FaultProxy.h) to chosen
// requests of a sync against the real share. Answers are sent from the
// server's own threads; a peer that goes away ends its answer.
#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <mutex>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

namespace vtc::test {

// The bytes sent for one request: the head, then the body `repeat` times,
// as fast as the peer takes them, or `piece` bytes at a time with a pause
// after each piece.
struct HostileAnswer {
  std::string head;  // status line and header lines, each ending in CRLF
  std::string body;
  uint64_t repeat = 1;
  size_t piece = 0;
  std::chrono::milliseconds pause{0};

  // A status line and headers with a Content-Length for the whole body
  // (announced: the body's size times repeat), or none (the body ends when
  // the connection closes).
  static HostileAnswer with(int status, std::string contentType, std::string body,
                            uint64_t repeat = 1, bool announced = true);
  uint64_t bodyBytes() const { return body.size() * repeat; }
};

struct HostileRequest {
  std::string method;
  std::string path;  // unescaped
};

// The length of the first whole request in buffered bytes, or 0 while none
// is complete (bodies come with a Content-Length).
size_t httpRequestLength(const std::string& buffered);
// Sends everything; false when the peer went away or `wake` turned readable.
bool sendAll(int fd, std::string_view data, int wake = -1);
// Sends an answer; false when it ended early.
bool sendAnswer(int fd, const HostileAnswer& answer, int wake);

class HostileServer {
 public:
  using Answerer = std::function<HostileAnswer(const HostileRequest&)>;

  explicit HostileServer(Answerer answerer);
  ~HostileServer();
  HostileServer(const HostileServer&) = delete;
  HostileServer& operator=(const HostileServer&) = delete;

  int port() const { return port_; }
  std::string url() const { return "http://127.0.0.1:" + std::to_string(port_); }
  std::vector<HostileRequest> requests() const;

 private:
  void serve(int client);

  Answerer answerer_;
  int port_ = 0;
  int listener_ = -1;
  int wake_ = -1;
  mutable std::mutex mutex_;
  std::vector<HostileRequest> requests_;
  std::vector<std::thread> connections_;
  std::thread acceptor_;
};

}  // namespace vtc::test
