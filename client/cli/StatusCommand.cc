// `status`: what this computer syncs and how its syncs went, and the
// computers of the account.
#include <ostream>

#include "VantorSyncManager/VTCPrefsCenter.h"
#include "client/cli/Commands.h"
#include "client/cli/StatusText.h"
#include "client/run/Account.h"
#include "client/run/Automation.h"
#include "client/run/ConflictStore.h"
#include "client/run/StatusReport.h"
#include "client/run/SyncFailure.h"
#include "common/Format.h"

namespace vtc::client {

int statusCommand(bool json, Output& output) {
  StatusReport status = gatherStatus();
  status.logFile = logFileShown();
  status.logLevel = configuredLogLevel();
  if (json) {
    output.out << statusAsJson(status) << "\n";
  } else {
    printStatus(status, output.out);
  }
  if (status.serverError && !json)
    output.err << "nubilosyncclient: " << *status.serverError << "\n";
  return status.serverErrorKind ? static_cast<int>(*status.serverErrorKind) : 0;
}

}  // namespace vtc::client
