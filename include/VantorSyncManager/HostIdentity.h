// The identity of this computer in sync reports.
#pragma once

#include <optional>
#include <string>

#include "VantorSyncManager/Export.h"

// The host's hardware UUID as upper-case 8-4-4-4-12 text (the machine id
// stands in where the firmware's is unreadable), kept for the life of the
// process once found; none, with a Warning line, when it cannot be found.
VSM_EXPORT std::optional<std::string> getHostUUIDString();
