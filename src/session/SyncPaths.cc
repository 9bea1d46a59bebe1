// Creation and removal of the sync area on the share.
#include "VantorSyncManager/NubiloException.h"
#include "VantorSyncManager/NubiloRemoteSession.h"
#include "VantorSyncManager/PublicNames.h"
#include "common/Logging.h"
#include "platform/dav/DavPaths.h"
#include "platform/dav/TesselSession.h"

namespace {

// The path without its last component: "/a/b" gives "/a", "/a" gives "/".
std::string deletingLastPathComponent(const std::string& path) {
  std::string p = path;
  while (p.size() > 1 && p.back() == '/') p.pop_back();
  size_t slash = p.find_last_of('/');
  if (slash == std::string::npos) return "";
  if (slash == 0) return "/";
  return p.substr(0, slash);
}

}  // namespace

bool NubiloRemoteSession::createSyncPaths() {
  DavTransaction t = _TesselSession->_makeCollectionsAtPaths({_clientsPath, _schemasPath});
  if (const auto& headers = t._responseHeaders()) {
    const vtc::Value* server = headers->find("X-Responding-Server");
    _respondingServer = server ? std::optional<std::string>(server->string()) : std::nullopt;
    if (_respondingServer) VTC_LOG_INFO("Responding server: %@", *_respondingServer);
  }
  if (t.transactionState() == vtc::kTransactionCompleted) return t.isSuccessful();

  // One collection at a time; an existing collection counts as done.
  DavTransaction clients = _TesselSession->makeCollectionAtPath(_clientsPath, true);
  if (clients.transactionState() != vtc::kTransactionCompleted) return false;
  DavTransaction schemas = _TesselSession->makeCollectionAtPath(_schemasPath, true);
  return schemas.transactionState() == vtc::kTransactionCompleted;
}

bool NubiloRemoteSession::removeSyncPaths() {
  // Collections, named as such: with their trailing "/".
  std::string parent = vtc::davpath::collection(deletingLastPathComponent(_syncPath));
  DavTransaction lock = _TesselSession->lockResourceAtPath(parent);
  if (!lock.isSuccessful())
    throw NubiloException(NubiloLockFailureException,
                          vtc::format("Resource is already locked, %@", parent));
  DavTransaction removal =
      _TesselSession->deleteResourceAtPath(vtc::davpath::collection(_syncPath));
  _TesselSession->unlockResourceAtPath(parent);  // whatever the deletion gave; result ignored
  return removal.isSuccessful();
}
