// The flattened form of a sync summary, and where reports live on the share.
#pragma once

#include <optional>
#include <string>

#include "VantorSyncManager/Value.h"

namespace vtc {

// Text keys and values: the fixed "appName", "Version" and "SyncStatus:code",
// the global entries, "RespondingServer" and "MachineGUID" when known, and
// "<dataclass>:<field>" for every dictionary entry of the summary.
Dictionary flattenedSyncReport(const Dictionary& summary,
                               const std::optional<std::string>& respondingServer,
                               const std::optional<std::string>& machineGUID);

// "<sync area>/Reports": one "<MachineGUID>.plist" per computer, or
// "<client guid>.plist" for a computer whose host UUID is unknown.
std::string reportsPathIn(const std::string& syncPath);

// Forgets the host UUID kept by getHostUUIDString (tests only).
void forgetHostUUIDForTesting();

}  // namespace vtc
