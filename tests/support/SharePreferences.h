// Points this home's per-user preferences at a share, so that the preference
// store's configuration opens sessions on it, the way a user's setup does.
#pragma once

#include "localshare/Share.h"

namespace vtc::test {

using local::Share;

// Writes the share's server and locking keys (not the client identity) as
// per-user preferences; port, when given, is that of a proxy in front of it.
// Call before the first use of the preference store's configuration.
void storeShareInPreferences(const Share& share, int port = 0);

}  // namespace vtc::test
