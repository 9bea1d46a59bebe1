// The client registry: one resource per computer under the clients
// collection, its sync-namespace properties the client's record.
#include <cstdio>

#include "VantorSyncManager/NubiloException.h"
#include "VantorSyncManager/NubiloRemoteSession.h"
#include "VantorSyncManager/PublicNames.h"
#include "VantorSyncManager/StringAdditions.h"
#include "VantorSyncManager/VTCPrefsCenter.h"
#include "common/Assertions.h"
#include "common/Clock.h"
#include "common/Logging.h"
#include "platform/dav/DavPaths.h"
#include "platform/dav/TesselSession.h"
#include "prefs/SyncEngineSettings.h"
#include "session/DataclassName.h"

namespace {

constexpr double kAuthorizationRetryPause = 30;

// "00012.client" -> "00012"; "client" extension only.
std::string withoutExtension(const std::string& name) {
  size_t dot = name.rfind('.');
  return dot == std::string::npos ? name : name.substr(0, dot);
}

}  // namespace

bool NubiloRemoteSession::registerClient(const std::string& guid, const std::string& name) {
  // An empty guid would register the resource ".client". When the handler's
  // policy carries on, nothing is registered.
  if (guid.empty()) {
    VTC_ASSERTION_FAILURE("NubiloRemoteSession", "registerClient",
                          "registerClient: client guid is missing!");
    return false;
  }
  if (name.empty()) {
    VTC_ASSERTION_FAILURE("NubiloRemoteSession", "registerClient",
                          "registerClient: client name is missing!");
    return false;
  }
  std::string strippedName = vtc::strippedClientName(name);
  std::string path = clientPath(guid);
  DavTransaction t = _TesselSession->basicAttributesAtPath(path);
  int64_t attempts = 0;
  while (t.httpStatusCode() == 401 && attempts < _maxLockAttempts) {
    ++attempts;
    VTC_LOG_WARNING("Authorization failure accessing %@, trying again in 30 seconds", path);
    messageTraceTransactionFailure(t, attempts >= _maxLockAttempts, attempts,
                                   "Failed to get basic attributes on Client");
    vtc::currentSleeper().sleepFor(vtc::Seconds(kAuthorizationRetryPause));
    t = _TesselSession->basicAttributesAtPath(path);
  }
  if (t.isSuccessful() && t.transactionState() == vtc::kTransactionCompleted) {
    VTC_LOG_WARNING("Attempt to register client that is already registered GUID:%@ Name:%@", guid,
                    strippedName);
    throw NubiloException(NubiloClientRegistrationException,
                          vtc::format("Client already registered %@", t.result()));
  }
  vtc::Dictionary props{
      {"guid", guid},
      {"clientname", strippedName},
      {"classname", SM_CLIENT_CLASS_BRAMBLE},
      {"buildversion", vtc::format("VantorSyncClient-%@", VantorSyncManagerVersionNumber)},
  };
  lockClients();
  // Results are not tested: a missing record is cleaned up by getAllClientInfo.
  putDataWithRetry({}, path);
  _issuePropPatchWithRetryAtPath(path, props, _syncNamespace);
  VTCPrefsCenter::defaultCenter().setClientGuid(guid);
  VTCPrefsCenter::defaultCenter().setClientName(strippedName);
  unlockClients();
  return true;
}

bool NubiloRemoteSession::unregisterClient(const std::string& guid) {
  std::string path = clientPath(guid);
  VTCPrefsCenter& prefs = VTCPrefsCenter::defaultCenter();
  if (prefs.clientGuid() == guid) {
    prefs.setLastSyncDate(std::nullopt);
    prefs.setLastSuccessfulSyncDate(std::nullopt);
  }
  lockClients();
  VTC_LOG_INFO("Unregistering client %@", guid);
  DavTransaction removal = _TesselSession->deleteResourceAtPath(path);
  unlockClients();
  return removal.isSuccessful();
}

std::vector<std::string> NubiloRemoteSession::clientRecordProperties() const {
  std::vector<std::string> names;
  for (const char* local :
       {"guid", "clientname", "classname", "buildversion", "lastsync", "firstsync"})
    names.push_back(_syncNamespace + local);
  for (const std::string& dataclass : _dataclassesMet) {
    names.push_back(_syncNamespace + dataclass + ".status");
    names.push_back(_syncNamespace + dataclass + ".version");
  }
  return names;
}

DavTransaction NubiloRemoteSession::findClientRecords(const std::string& path, int32_t depth) {
  const bool withParent = depth == kDAVZeroDepth;
  if (_clientRecordsByName)
    return _issuePropFindWithRetryAtPath(path, depth, clientRecordProperties(), withParent);
  DavTransaction all = _issuePropFindWithRetryAtPath(path, depth, {}, withParent);
  if (!all.isSuccessful()) return all;
  const std::string guid = _syncNamespace + "guid";
  auto lacksGuid = [&](const DavTransaction& t) {
    for (const auto& [href, props] : t.result().dictionary())
      if (href.ends_with("client") && !props.dictionary().contains(guid)) return true;
    return false;
  };
  if (!lacksGuid(all)) return all;
  // A broken record, or a server that leaves dead properties out of an
  // answer for all of them: asked by name, the second finds the guid.
  DavTransaction named =
      _issuePropFindWithRetryAtPath(path, depth, clientRecordProperties(), withParent);
  if (!named.isSuccessful()) return all;
  for (const auto& [href, props] : named.result().dictionary())
    if (props.dictionary().contains(guid)) _clientRecordsByName = true;
  return _clientRecordsByName ? named : all;
}

vtc::Dictionary NubiloRemoteSession::getClientInfo(const std::string& guid) {
  std::string path = stringByAppendingTesselPathComponent(
      stringByAppendingTesselPathComponent(_syncPath, "Clients"), guid + ".client");
  DavTransaction t = findClientRecords(path, kDAVZeroDepth);
  if (t.isSuccessful()) {
    // Looked up under the href that was asked for: a server that names the
    // resource otherwise yields an empty record, not a failure.
    const vtc::Value& found = t.result().dictionary().get(vtc::davpath::escape(path));
    vtc::Dictionary record = recordFromProperties(found.dictionary());
    _clientsInfo.set(guid, vtc::Value(record));
    return record;
  }
  VTC_LOG_ERROR("Failed to obtain client info for %@", guid);
  messageTraceTransactionFailure(t, true, 0, "Failed get client info");
  switch (t.httpStatusCode()) {
    case 404:
      throw NubiloException(
          NubiloClientRegistrationException,
          vtc::format("Attempting to get client info for a client that doesn't exist, %@", path));
    case 402:
      throw NubiloException(
          NubiloAccountExpiredException,
          vtc::format("Attempting to get client info failed because account has expired %@", t));
    case 508:
      throw NubiloException(NubiloAccountMigratedException,
                            vtc::format("Account has been migrated: %@", t));
    default:
      throw NubiloException(NubiloTransactionFailureException,
                            vtc::format("Client info could not be obtained for %@ %@", path, t));
  }
}

vtc::Dictionary NubiloRemoteSession::getClientInfo() {
  return getClientInfo(_configuration.get("guid").string());
}

vtc::Array NubiloRemoteSession::getAllClientInfo() {
  DavTransaction t = findClientRecords(vtc::davpath::collection(_clientsPath), kDAVOneDepth);
  vtc::Array records;
  if (!t.isSuccessful()) return records;
  for (const auto& [href, props] : t.result().dictionary()) {
    std::string last = vtc::davpath::lastComponent(vtc::davpath::fromHref(href));
    if (last == ".client") {
      VTC_LOG_ERROR("Invalid client found removing...");
      unregisterClient("");
      continue;
    }
    if (!href.ends_with("client")) continue;
    vtc::Dictionary record = recordFromProperties(props.dictionary());
    if (!record.contains("guid") || !record.contains("clientname")) {
      VTC_LOG_ERROR("Missing guid or name found on client %@ removing...", href);
      unregisterClient(withoutExtension(last));
    }
    // A broken record is returned once more, in the call that removes it.
    records.push_back(vtc::Value(std::move(record)));
  }
  return records;
}

bool NubiloRemoteSession::setInfoForClient(const vtc::Dictionary& properties,
                                           const std::string& guid) {
  if (properties.empty()) return true;
  std::string path = clientPath(guid);
  VTC_LOG_INFO("Patching client info at path %@ with properties %@", path, properties);
  return _issuePropPatchWithRetryAtPath(path, properties, _syncNamespace).isSuccessful();
}

bool NubiloRemoteSession::patchClientInfo(const vtc::Dictionary& properties) {
  return setInfoForClient(properties, _configuration.get("guid").string());
}

void NubiloRemoteSession::setStatus(const std::string& status, const std::string& guid,
                                    const std::string& dataclass) {
  vtc::requirePlainDataclassName(dataclass);  // it names properties
  _dataclassesMet.insert(dataclass);
  setInfoForClient(vtc::Dictionary{{dataclass + ".status", status}}, guid);
}

void NubiloRemoteSession::setOtherClientStatus(const std::string& status,
                                               const std::string& dataclass) {
  vtc::requirePlainDataclassName(dataclass);
  _dataclassesMet.insert(dataclass);
  relockClients();
  DavTransaction listing = _TesselSession->listCollectionAtPath(_clientsPath);
  const std::string own = _configuration.get("guid").string();
  for (const auto& entry : listing.result().array()) {
    std::string last = vtc::davpath::lastComponent(entry.dictionary().get(kNBURI).string());
    if (!last.ends_with(".client")) continue;
    std::string guid = withoutExtension(last);
    if (guid == own) continue;
    vtc::Dictionary record = getClientInfo(guid);  // raises, ending the loop, on failure
    vtc::Dictionary patch;
    const std::string statusKey = dataclass + ".status";
    const std::string versionKey = dataclass + ".version";
    if (record.get(statusKey) != vtc::Value(status)) patch.set(statusKey, vtc::Value(status));
    if (status != "normal" && record.contains(versionKey))
      patch.set(versionKey, vtc::Value(kNBRemoveProp));
    setInfoForClient(patch, guid);  // sends nothing when nothing changes
  }
}

void NubiloRemoteSession::setAllClientStatus(const std::string& status,
                                             const std::string& dataclass) {
  setOtherClientStatus(status, dataclass);
  setStatus(status, _configuration.get("guid").string(), dataclass);
}

void NubiloRemoteSession::setStatus(const std::optional<std::string>& status,
                                    const std::string& dataclass) {
  setInfoForDataclass(
      vtc::Dictionary{{"status", status ? vtc::Value(*status) : vtc::Value(kNBRemoveProp)}},
      dataclass);
}
