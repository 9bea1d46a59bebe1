// The sync client's own folder: the engine, the conflicts kept and the
// records set aside live there.
#pragma once

#include <string>

namespace vtc::client {

// The library's application support folder, else "NubiloSyncClient" in the
// user's data folder.
std::string supportFolder();

}  // namespace vtc::client
