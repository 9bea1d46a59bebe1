// initVTCLogger: what the log is set up with, read from the preferences
// once per process and handed to the log below.
#include <strings.h>

#include <string>

#include "common/Logging.h"
#include "platform/fs/LocalPaths.h"
#include "platform/prefs/PreferenceFiles.h"
#include "platform/workspace/ApplicationLookup.h"

namespace {

constexpr const char* kLogPath = "~/Library/Logs/Sync/nubilosync.log";
constexpr const char* kPreferenceDomain = "com.korvo.VantorSync";

int levelFromWord(const std::string& word) {
  if (strcasecmp(word.c_str(), "debug") == 0) return 3;
  if (strcasecmp(word.c_str(), "info") == 0) return 2;
  if (strcasecmp(word.c_str(), "warn") == 0) return 1;
  if (strcasecmp(word.c_str(), "error") == 0) return 0;
  // "verbose" silences everything, errors included; kept as configured.
  if (strcasecmp(word.c_str(), "verbose") == 0) return -1;
  return 1;
}

}  // namespace

std::string vtc::log::logFilePath() {
  return vtc::paths::expandTilde(kLogPath);
}

extern "C" VSM_EXPORT void initVTCLogger(void) {
  if (vtc::log::configured()) return;
  int level = 0;
  const vtc::Value word = vtc::prefs::copyAppValue("LoggingLevel", kPreferenceDomain);
  if (word.isNone()) {
    // A computer with the internal bug-reporting tool installed logs Info.
    if (vtc::workspace::applicationInstalled("Ticketer.app")) level = 2;
  } else {
    level = levelFromWord(word.isString() ? word.string() : word.description());
  }
  const vtc::Value roll = vtc::prefs::copyAppValue("RollLogs", kPreferenceDomain);
  const std::string file = vtc::log::logFilePath();
  // A folder that cannot be made shows up as a failed open: lines dropped.
  vtc::paths::makeDirectories(file.substr(0, file.find_last_of('/')), 0755);
  vtc::log::configure(level, file, roll.isNone() || roll.boolean());
}
