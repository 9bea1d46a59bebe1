#include "client/run/ForeignLocks.h"

#include <cstdlib>

#include "VantorSyncManager/NubiloRemoteSession.h"
#include "common/Logging.h"
#include "platform/dav/TesselSession.h"

namespace vtc::client {

size_t releaseLocksOf(NubiloRemoteSession& session, const std::string& path,
                      const std::string& clientId) {
  if (clientId.empty()) return 0;
  DavTransaction attributes = session.tesselSession().extendedAttributesAtPath(path);
  size_t released = 0;
  for (const Value& held : attributes.result().dictionary().get("DAV:lockdiscovery").array()) {
    const Dictionary& lock = held.dictionary();
    if (lock.get("clientid").string() != clientId) continue;
    VTC_LOG_WARNING("Giving back a lock of %@ left on %@", lock.get("clientname").string(), path);
    if (session.tesselSession()
            .unlockResourceWithToken(path, lock.get("token").string())
            .isSuccessful())
      ++released;
  }
  return released;
}

bool abandonedLock(const Dictionary& lock, int64_t lockDuration) {
  const std::string& timeout = lock.get("timeout").string();
  if (lockDuration <= 0 || !timeout.starts_with("Second-")) return false;
  char* end = nullptr;
  const long long left = std::strtoll(timeout.c_str() + 7, &end, 10);
  if (end == timeout.c_str() + 7 || *end) return false;
  return (lockDuration - left) * 5 > lockDuration * 3;
}

std::string takeoverSentence(const std::string& what, const Dictionary& lock) {
  std::string holder = lock.get("clientname").string();
  if (holder.empty()) holder = "another computer";
  const std::string since = lock.get("acquiredate").string().substr(0, 19);
  return "Took over the lock of " + what + " that " + holder + " took" +
         (since.empty() ? "" : " at " + since) +
         " and stopped renewing: its sync ended without giving the lock back.";
}

}  // namespace vtc::client
