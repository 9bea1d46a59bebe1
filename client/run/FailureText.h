// The plain sentence (and the exit status) for a failure of the library,
// and whether a download failure means damage on the share or only a
// passing fault.
#pragma once

#include <optional>
#include <string>

#include "VantorSyncManager/NubiloException.h"
#include "client/run/SyncFailure.h"

namespace vtc::client {

// The HTTP status that a failure's reason names (its transaction's), if any.
std::optional<int> httpStatusIn(const NubiloException& e);

// Damage: a changelog that cannot be decoded, or that is missing (404) or
// empty; not a server error of the moment.
bool showsDamage(const NubiloException& e);

std::string failureSentence(const std::string& dataclass, const NubiloException& e);
FailureKind failureKind(const NubiloException& e);

}  // namespace vtc::client
