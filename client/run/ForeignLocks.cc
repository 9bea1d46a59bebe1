#include "client/run/ForeignLocks.h"

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

}  // namespace vtc::client
