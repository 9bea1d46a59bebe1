// The identity of this computer in sync reports.
#pragma once

#include <optional>
#include <string>

#include "VantorSyncManager/Export.h"

// This computer's UUID for the share as upper-case 8-4-4-4-12 text: derived
// from the machine id with a key of this application's own, never the id
// itself; kept for the life of the process once found; none, with a Warning
// line, when it cannot be found.
VSM_EXPORT std::optional<std::string> getHostUUIDString();
