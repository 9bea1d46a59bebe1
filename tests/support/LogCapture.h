// Reads back the lines that the library writes to its log file during a test.
// It sets the log to a level for the test (the per-user "LoggingLevel"; a
// per-host value would still win), starts the log afresh so that the level is
// read again, and reads only what was written after it was made. Make it
// after the TestHome whose log it reads.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

namespace vtc::test {

class LogCapture {
 public:
  struct Line {
    std::string level;    // "Error", "Warning", "Info", "Debug" or "????"
    std::string message;  // the text after the level word, continuation lines included
  };

  explicit LogCapture(const std::string& level = "info");
  ~LogCapture();
  LogCapture(const LogCapture&) = delete;
  LogCapture& operator=(const LogCapture&) = delete;

  std::vector<Line> lines() const;
  // The messages written with this level word, in order.
  std::vector<std::string> messages(const std::string& level) const;
  // How many lines of this level carry exactly this message.
  size_t count(const std::string& level, const std::string& message) const;

 private:
  uintmax_t start_ = 0;
};

}  // namespace vtc::test
