#include "client/run/SupportFolder.h"

#include "VantorSyncManager/VTCPrefsCenter.h"
#include "platform/fs/LocalPaths.h"

namespace vtc::client {

std::string supportFolder() {
  return VTCPrefsCenter::applicationSupportDirectory().value_or(
      paths::join(paths::applicationSupportDirectory(), "NubiloSyncClient"));
}

}  // namespace vtc::client
