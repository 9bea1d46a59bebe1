// Where preference domains live on disk, and the read of one key through a
// domain's application search list (per-host file first, then per-user).
#pragma once

#include <string>
#include <string_view>

#include "VantorSyncManager/Value.h"

namespace vtc::prefs {

// The string that names this computer in per-host file names: /etc/machine-id.
std::string byHostIdentifier();

// ~/Library/Preferences/<domain>.plist
std::string perUserFile(std::string_view domain);

// ~/Library/Preferences/ByHost/<domain>.<host id>.plist
std::string perHostFile(std::string_view domain);

// The key's value in the per-host file, else in the per-user file, else none.
// Unreadable files count as empty.
Value copyAppValue(std::string_view key, std::string_view domain);

}  // namespace vtc::prefs
