// _VTCLog and the line writer. The process-wide statics are never freed;
// the once-guard and the lazy open are deliberately unsynchronised (a second
// initialisation in a race only repeats the same work). What the log is set
// up with (level, file, rolling) comes from initVTCLogger, which reads it
// from the preferences and hands it to configure().
#include <fcntl.h>
#include <pthread.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <algorithm>
#include <cstdarg>
#include <cstdio>
#include <cstring>
#include <ctime>
#include <string>
#include <vector>

#include "common/Clock.h"
#include "common/Logging.h"
#include "common/Utf8.h"

namespace {

bool loggerInited = false;
int32_t currentLogLevel = 0;
int32_t logFile = 0;
std::string logPath;  // set by configure

constexpr off_t kRollSize = 4194305;  // more than 4 MiB

const char* levelWord(int level) {
  switch (level) {
    case 0:
      return "Error";
    case 1:
      return "Warning";
    case 2:
      return "Info";
    case 3:
      return "Debug";
    default:
      return "????";
  }
}

std::string rolledPath(const std::string& path) {
  return path.substr(0, path.size() - std::strlen("log")) + "0.log";
}

void rollIfLarge(const std::string& path) {
  struct stat st {};
  if (::stat(path.c_str(), &st) != 0 || st.st_size < kRollSize) return;
  std::string old = rolledPath(path);
  ::unlink(old.c_str());                   // failure ignored
  std::rename(path.c_str(), old.c_str());  // failure ignored
}

// Replaces every byte that does not belong to a well-formed UTF-8 sequence
// with '?', in place.
void sanitizeUtf8(char* s, size_t n) {
  auto* p = reinterpret_cast<unsigned char*>(s);
  char32_t ignored;
  for (size_t i = 0; i < n;) {
    const size_t length = vtc::utf8::decode(p + i, p + n, ignored);
    if (length == 0) {
      p[i++] = '?';
      continue;
    }
    i += length;
  }
}

std::string timestamp() {
  auto now = vtc::currentClock().now();
  auto ms = std::chrono::duration_cast<std::chrono::milliseconds>(now.time_since_epoch()).count();
  std::time_t secs = static_cast<std::time_t>(ms / 1000);
  std::tm tm{};
  localtime_r(&secs, &tm);
  char buf[64];
  size_t n = std::strftime(buf, sizeof buf, "%Y-%m-%d %H:%M:%S", &tm);
  std::snprintf(buf + n, sizeof buf - n, ":%03d", static_cast<int>(ms % 1000));
  return buf;
}

const char* lastPathComponent(const char* file) {
  if (!file) return "";
  const char* slash = std::strrchr(file, '/');
  return slash ? slash + 1 : file;
}

// The C entry point's "%@" takes a const char*: turn every "%@" into "%s" and
// let vsnprintf do the rest.
std::string cFormat(const char* format) {
  std::string out;
  for (const char* p = format; *p; ++p) {
    out += *p;
    if (*p != '%') continue;
    ++p;
    if (!*p) break;
    if (*p == '%') {
      out += '%';
      continue;
    }
    while (*p && std::strchr("-+ #0'.0123456789*hlLqjzt", *p)) out += *p++;
    if (!*p) break;
    out += (*p == '@') ? 's' : *p;
  }
  return out;
}

}  // namespace

extern "C" VSM_EXPORT void _VTCLog(const char* file, int line, const char* function, int level,
                                   const char* format, ...) {
  initVTCLogger();
  if (currentLogLevel < level) return;
  va_list args;
  va_start(args, format);
  std::string fmt = cFormat(format ? format : "");
  va_list copy;
  va_copy(copy, args);
  int len = std::vsnprintf(nullptr, 0, fmt.c_str(), copy);
  va_end(copy);
  std::string message(static_cast<size_t>(len > 0 ? len : 0), '\0');
  if (len > 0) std::vsnprintf(message.data(), message.size() + 1, fmt.c_str(), args);
  va_end(args);
  vtc::log::writeLine(file, line, function, level, message);
}

namespace vtc::log {

bool wants(int level) {
  initVTCLogger();
  return currentLogLevel >= level;
}

void configure(int level, const std::string& file, bool roll) {
  setlogmask(0xFF);
  currentLogLevel = level;
  logPath = file;
  if (roll) rollIfLarge(file);
  loggerInited = true;
  setlogmask(0xFF);
}

bool configured() {
  return loggerInited;
}

void writeLine(const char* file, int line, const char* function, int level,
               std::string_view message) {
  if (logFile == 0) {
    int fd = ::open(logPath.c_str(), O_RDWR | O_APPEND | O_CREAT | O_CLOEXEC, 0600);
    if (fd == 0) return;
    logFile = fd;  // -1 when the open failed: lines are dropped from now on
  }
  std::string stamp = timestamp();
  unsigned thread = static_cast<unsigned>(static_cast<uint64_t>(pthread_self()) & 0xFFFFFFFFu);
  // A line of up to 256 bytes is assembled on the stack; a longer one, its
  // head formatted again if that alone did not fit, on the heap. Nothing is cut.
  auto formatHead = [&](char* buf, size_t size) {
    if (currentLogLevel == 3)
      return std::snprintf(buf, size, "%s|%s:%i %s|%x|%s|", stamp.c_str(), lastPathComponent(file),
                           line, function ? function : "", thread, levelWord(level));
    return std::snprintf(buf, size, "%s|%x|%s|", stamp.c_str(), thread, levelWord(level));
  };
  char small[256];
  const int headLength = formatHead(small, sizeof small);
  if (headLength < 0) return;
  const auto head = static_cast<size_t>(headLength);
  const size_t total = head + message.size() + 1;
  char* buf = small;
  std::vector<char> large;
  if (total > sizeof small) {
    large.resize(total + 1);  // and snprintf's terminating zero
    buf = large.data();
    if (head < sizeof small)
      std::memcpy(buf, small, head);
    else
      formatHead(buf, large.size());
  }
  std::memcpy(buf + head, message.data(), message.size());
  buf[total - 1] = '\n';
  sanitizeUtf8(buf, total);
  if (logFile >= 0) {
    ssize_t ignored = ::write(logFile, buf, total);  // one write per line, no retry
    (void)ignored;
  }
}

void resetForTesting() {
  if (logFile > 0) ::close(logFile);
  logFile = 0;
  loggerInited = false;
  currentLogLevel = 0;
}

}  // namespace vtc::log
