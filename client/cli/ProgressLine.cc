#include "client/cli/ProgressLine.h"

#include "common/Format.h"

namespace vtc::client {

namespace {

std::string bytesText(int64_t bytes) {
  if (bytes < 1024) return format("%ld B", static_cast<long>(bytes));
  if (bytes < 1024 * 1024) return format("%.1f KB", static_cast<double>(bytes) / 1024);
  return format("%.1f MB", static_cast<double>(bytes) / (1024 * 1024));
}

}  // namespace

void ProgressLine::step(const std::string& dataclass, const char* what, size_t done, size_t total,
                        int64_t bytes) {
  const auto now = Clock::now();
  const std::string step = dataclass + ": " + what;
  if (step != step_) {
    step_ = step;
    stepStarted_ = now;
  } else if (now - lastDrawn_ < std::chrono::milliseconds(100)) {
    return;  // redrawn at most ten times a second
  }
  lastDrawn_ = now;
  std::string line = step;
  if (total > 0) line += format(" %zu/%zu", done, total);
  if (bytes > 0) line += ", " + bytesText(bytes);
  const double elapsed = std::chrono::duration<double>(now - stepStarted_).count();
  if (total > 0 && done > 0 && elapsed > 0.2) {
    const double left = elapsed * static_cast<double>(total - done) / static_cast<double>(done);
    line += format(", about %.0f s left", left);
  }
  std::fprintf(terminal_, "\r\033[K%s", line.c_str());
  std::fflush(terminal_);
  drawn_ = true;
}

void ProgressLine::done(const std::string&) {
  clear();
}

void ProgressLine::clear() {
  if (!drawn_) return;
  std::fprintf(terminal_, "\r\033[K");
  std::fflush(terminal_);
  drawn_ = false;
  step_.clear();
}

}  // namespace vtc::client
