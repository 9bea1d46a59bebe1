// The C++ side of the log: typed macros whose "%@" takes any value with a
// text form. They write through the same line writer as _VTCLog.
#pragma once

#include <string>
#include <string_view>

#include "VantorSyncManager/Log.h"
#include "common/Format.h"

namespace vtc::log {

enum Level : int { kError = 0, kWarning = 1, kInfo = 2, kDebug = 3 };

// Whether a line of this level is written; initialises the log on first use.
bool wants(int level);

// Steps after the level test: open the file, stamp, and write one line.
void writeLine(const char* file, int line, const char* function, int level,
               std::string_view message);

// Sets the log up for the process: lines are written up to `level` into
// `file` (whose folder exists), rolled first when `roll` is set and the file
// has grown past 4 MiB. initVTCLogger calls it once, with what the
// preferences say.
void configure(int level, const std::string& file, bool roll);
// Whether configure has run (since the last resetForTesting).
bool configured();

// The log file for this process's $HOME, the one initVTCLogger hands to
// configure (defined beside it).
std::string logFilePath();

// Closes the file and forgets the configured level, so that the next line
// reads the preferences again (tests only).
void resetForTesting();

}  // namespace vtc::log

#define VTC_LOG(level, ...)                                                   \
  do {                                                                        \
    if (::vtc::log::wants(level))                                             \
      ::vtc::log::writeLine(__FILE__, __LINE__, __PRETTY_FUNCTION__, (level), \
                            ::vtc::format(__VA_ARGS__));                      \
  } while (0)

#define VTC_LOG_ERROR(...) VTC_LOG(::vtc::log::kError, __VA_ARGS__)
#define VTC_LOG_WARNING(...) VTC_LOG(::vtc::log::kWarning, __VA_ARGS__)
#define VTC_LOG_INFO(...) VTC_LOG(::vtc::log::kInfo, __VA_ARGS__)
#define VTC_LOG_DEBUG(...) VTC_LOG(::vtc::log::kDebug, __VA_ARGS__)
