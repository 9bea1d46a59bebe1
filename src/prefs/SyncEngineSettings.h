// What the preferences ask of the sync engine's record of this client.
#pragma once

#include <optional>
#include <string>

#include "VantorSyncManager/Value.h"

namespace vtc {

// This client's name with control characters removed.
std::string strippedClientName(const std::string& name);

// The last successful sync date that the engine's record of this client
// holds from before the preferences kept it, and its removal there. Both
// may throw what the engine throws.
std::optional<Date> engineLastSuccessfulSyncDate();
void removeEngineLastSuccessfulSyncDate();

// Tells the engine's record of this client to sync after other clients,
// and to sync with clients of the types "app", "device" and "peer", or
// neither. Without a record it does nothing. An engine failure is an Error
// line.
void setSyncsAfterOtherClients(bool on);

}  // namespace vtc
