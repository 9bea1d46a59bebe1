// `config`, `config get NAME` and `config set NAME VALUE`: the settings a
// user may change without editing a property list, this computer's name
// (shown to the other computers from its next sync) and the log's level.
#include <ostream>

#include "VantorSyncManager/PublicNames.h"
#include "VantorSyncManager/VTCPrefsCenter.h"
#include "client/cli/Commands.h"
#include "client/cli/TerminalText.h"
#include "client/run/SyncFailure.h"
#include "platform/prefs/PreferenceStore.h"

namespace vtc::client {

namespace {

constexpr const char* kLogLevelKey = "LoggingLevel";
const char* const kLevels[] = {"error", "warn", "info", "debug"};

}  // namespace

std::string configuredLogLevel() {
  const Value level =
      prefs::PreferenceStore::shared().copyAppValue(kLogLevelKey, kVantorDefaultsKey);
  return level.isString() ? level.string() : "error";
}

namespace {

void requireKnown(const std::string& name) {
  if (name != "name" && name != "log-level")
    throw SyncFailure(FailureKind::Usage,
                      "There is no setting \"" + name + "\"; the settings are name and log-level.");
}

}  // namespace

int configCommand(const std::string& action, const std::string& name, const std::string& value,
                  Output& output) {
  VTCPrefsCenter& prefs = VTCPrefsCenter::defaultCenter();
  if (action.empty()) {
    output.out << "name " << shownSafely(prefs.clientName().value_or("")) << "\n"
               << "log-level " << configuredLogLevel() << "\n";
    return 0;
  }
  requireKnown(name);
  if (action == "get") {
    output.out << (name == "name" ? shownSafely(prefs.clientName().value_or(""))
                                  : configuredLogLevel())
               << "\n";
    return 0;
  }
  if (name == "name") {
    if (value.empty() || value.size() > 200 || value.find_first_of("\r\n\t") != std::string::npos)
      throw SyncFailure(FailureKind::Usage,
                        "A computer's name is one line of at most 200 characters.");
    prefs.setClientName(value);
    if (output.verbosity > 0)
      output.out << "This computer is now called " << shownSafely(value)
                 << "; the other computers see the name from its next sync.\n";
    return 0;
  }
  bool known = false;
  for (const char* level : kLevels) known = known || value == level;
  if (!known)
    throw SyncFailure(FailureKind::Usage,
                      "\"" + value + "\" is not a log level; use error, warn, info or debug.");
  auto& store = prefs::PreferenceStore::shared();
  store.setValue(kLogLevelKey, Value(value), kVantorDefaultsKey, prefs::Scope::CurrentHost);
  store.synchronize(kVantorDefaultsKey, prefs::Scope::CurrentHost);
  if (output.verbosity > 0) {
    const char* what = value == "error"  ? "errors"
                       : value == "warn" ? "warnings and errors"
                       : value == "info" ? "what each sync does, warnings and errors"
                                         : "everything, requests included";
    output.out << "The log (" << logFileShown() << ") now records " << what << ".\n";
  }
  return 0;
}

std::string logFileShown() {
  return "~/Library/Logs/Sync/nubilosync.log";
}

}  // namespace vtc::client
