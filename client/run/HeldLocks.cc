#include "client/run/HeldLocks.h"

#include <filesystem>

#include "VantorSyncManager/NubiloRemoteSession.h"
#include "VantorSyncManager/VTCPrefsCenter.h"
#include "common/Logging.h"
#include "platform/dav/TesselSession.h"
#include "platform/fs/LocalPaths.h"
#include "platform/plist/PlistCodec.h"

namespace vtc::client {

HeldLocks::HeldLocks(NubiloRemoteSession& session) : session_(session) {
  if (auto folder = VTCPrefsCenter::applicationSupportDirectory())
    file_ = paths::join(*folder, "HeldLocks.plist");
}

void HeldLocks::releaseLeftovers() {
  if (file_.empty()) return;
  auto leftovers = plist::readFile(file_);
  if (!leftovers) return;
  for (const auto& [path, token] : leftovers->dictionary()) {
    DavTransaction t = session_.tesselSession().unlockResourceWithToken(path, token.string());
    // A lock that expired meanwhile is refused: it is gone either way.
    VTC_LOG_INFO("Gave back lock %@ left by an earlier run: %@", path, t);
  }
  clear();
}

void HeldLocks::record() {
  if (file_.empty()) return;
  Dictionary held;
  for (const std::string& path : session_.lockedResources())
    if (auto token = session_.tesselSession().lockTokenForPath(path)) held.set(path, Value(*token));
  if (held.empty()) return clear();
  if (!plist::writeFileAtomically(file_, Value(held)))
    VTC_LOG_WARNING("Could not record the held locks in %@", file_);
}

void HeldLocks::clear() {
  if (file_.empty()) return;
  std::error_code ignored;  // a missing record is what clearing wants
  std::filesystem::remove(file_, ignored);
}

}  // namespace vtc::client
