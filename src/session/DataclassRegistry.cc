// The dataclass registry: reading, registering and describing dataclass
// collections and their records.
#include <cstdio>
#include <mutex>

#include "VantorSyncManager/NubiloException.h"
#include "VantorSyncManager/NubiloRemoteSession.h"
#include "VantorSyncManager/PublicNames.h"
#include "VantorSyncManager/StringAdditions.h"
#include "common/Logging.h"
#include "platform/dav/DavPaths.h"
#include "platform/dav/TesselSession.h"
#include "session/DataclassName.h"

std::string NubiloRemoteSession::dataclassPath(const std::string& dataclass) const {
  vtc::requirePlainDataclassName(dataclass);  // one component below the schemas, never more
  return stringByAppendingTesselPathComponent(_schemasPath, dataclass);
}

vtc::Dictionary NubiloRemoteSession::recordFromProperties(const vtc::Dictionary& properties) const {
  vtc::Dictionary record;
  for (const auto& [name, value] : properties)
    if (name.size() > _namespaceLength && name.compare(0, _namespaceLength, _syncNamespace) == 0)
      record.set(name.substr(_namespaceLength), value);
  return record;
}

std::vector<std::string> NubiloRemoteSession::dataclassRecordProperties() const {
  std::vector<std::string> names;
  for (const char* local : {"displayname", "dataclassname", "minversion", "maxversion", "status",
                            "lastsync", "truthdigest"})
    names.push_back(_syncNamespace + local);
  names.push_back("DAV:getetag");
  return names;
}

vtc::Dictionary NubiloRemoteSession::getDataclassInfo(const std::string& dataclass) {
  const std::string path = vtc::davpath::collection(dataclassPath(dataclass));
  _dataclassesMet.insert(dataclass);
  const std::vector<std::string> properties = dataclassRecordProperties();
  DavTransaction t;
  {
    // Re-entrant: the registration's locks take the same monitor.
    std::lock_guard<std::recursive_mutex> monitor(_TesselSession->monitor());
    t = _issuePropFindWithRetryAtPath(path, kDAVZeroDepth, properties);
    if (!t.isSuccessful() && t.httpStatusCode() == 404) {
      registerDataclass(dataclass);
      t = _issuePropFindWithRetryAtPath(path, kDAVZeroDepth, properties);
    }
  }
  vtc::Dictionary result;
  if (t.isSuccessful() && !t.result().dictionary().empty()) {
    const vtc::Dictionary& props = std::prev(t.result().dictionary().end())->second.dictionary();
    result = recordFromProperties(props);
    const vtc::Value* etag = props.find("DAV:getetag");
    if (!etag)
      VTC_LOG_WARNING("No etag found for dataclass %@, setting generic no etag string", dataclass);
    result.set("DAV:getetag", etag ? *etag : vtc::Value(vtc::kNoETag));
  } else if (t.httpStatusCode() == 402) {
    throw NubiloException(
        NubiloAccountExpiredException,
        vtc::format("Attempting to get dataclass info failed because account has expired %@", t));
  } else {
    messageTraceTransactionFailure(t, true, 0, "Failed to get dataclass info");
    throw NubiloException(
        NubiloTransactionFailureException,
        vtc::format("Dataclass info could not be obtained for %@ %@", dataclass, t));
  }
  VTC_LOG_INFO("Getting dataclass info %@", result);
  return result;
}

vtc::Array NubiloRemoteSession::getAllDataclassInfo() {
  DavTransaction t = _issuePropFindWithRetryAtPath(
      vtc::davpath::collection(_schemasPath), kDAVOneDepth, dataclassRecordProperties(), false);
  vtc::Array records;
  if (!t.isSuccessful()) return records;
  for (const auto& [href, props] : t.result().dictionary()) {
    // A name from the share becomes part of property names: plain ones only.
    std::string name = vtc::davpath::lastComponent(vtc::davpath::fromHref(href));
    if (vtc::isPlainDataclassName(name)) _dataclassesMet.insert(std::move(name));
    records.push_back(vtc::Value(recordFromProperties(props.dictionary())));
  }
  return records;
}

std::vector<std::string> NubiloRemoteSession::dataclassNames() {
  DavTransaction t = _TesselSession->listCollectionAtPath(_schemasPath);
  std::vector<std::string> names;
  if (!t.isSuccessful()) return names;
  for (const auto& entry : t.result().array()) {
    std::string name = vtc::davpath::lastComponent(entry.dictionary().get(kNBURI).string());
    if (vtc::isPlainDataclassName(name))
      names.push_back(std::move(name));
    else
      VTC_LOG_WARNING("Ignoring a member of the schemas collection that names no dataclass");
  }
  return names;
}

void NubiloRemoteSession::dumpDataclasses() {
  DavTransaction t = _issuePropFindWithRetryAtPath(
      vtc::davpath::collection(_schemasPath), kDAVOneDepth, dataclassRecordProperties(), false);
  if (!t.isSuccessful()) return;
  for (const auto& [href, props] : t.result().dictionary()) {
    std::fprintf(stderr, "%s\n", href.c_str());
    for (const auto& [name, value] : recordFromProperties(props.dictionary()))
      std::fprintf(stderr, "%s\t%s\n", name.c_str(), vtc::textOf(value).c_str());
  }
}

bool NubiloRemoteSession::registerDataclass(const std::string& dataclass) {
  std::string path = dataclassPath(dataclass);
  if (_TesselSession->_issuePropFindAtPath(path + "/", kDAVZeroDepth, {kNBLastModified})
          .isSuccessful())
    return false;
  VTC_LOG_INFO("Creating dataclass directory for %@", dataclass);
  lockDataclasses();
  // Results are not tested: a failure shows up later as an incoherent record.
  _TesselSession->makeCollectionAtPath(path, false);
  _issuePropPatchWithRetryAtPath(
      path + "/", vtc::Dictionary{{"displayname", dataclass}, {"dataclassname", dataclass}},
      _configuration.get("sync_namespace").string());
  unlockDataclasses();
  return true;
}

bool NubiloRemoteSession::setInfoForDataclass(const vtc::Dictionary& properties,
                                              const std::string& dataclass) {
  if (properties.empty()) return true;
  std::string path = dataclassPath(dataclass);
  VTC_LOG_INFO("Patching dataclass info at path %@ with properties %@", path, properties);
  return _issuePropPatchWithRetryAtPath(path + "/", properties, _syncNamespace).isSuccessful();
}

std::vector<std::string> NubiloRemoteSession::changeLogVersionsForDataclass(
    const std::string& dataclass) {
  DavTransaction t = _TesselSession->listCollectionAtPath(dataclassPath(dataclass));
  std::vector<std::string> versions;
  if (!t.isSuccessful()) return versions;
  for (const auto& entry : t.result().array()) {
    std::string name = vtc::davpath::lastComponent(entry.dictionary().get(kNBURI).string());
    size_t dot = name.rfind('.');
    if (dot != std::string::npos && name.compare(dot + 1, std::string::npos, "clog") == 0)
      versions.push_back(name.substr(0, dot));
  }
  // Zero-padded to five digits, so text order is number order.
  std::sort(versions.begin(), versions.end());
  return versions;
}

vtc::Dictionary NubiloRemoteSession::calculatePropertiesForDataclass(const std::string& dataclass) {
  std::vector<std::string> versions = changeLogVersionsForDataclass(dataclass);
  vtc::Dictionary props;
  props.set("minversion",
            versions.empty() ? vtc::Value(kNBRemoveProp) : vtc::Value(versions.front()));
  props.set("maxversion",
            versions.empty() ? vtc::Value(kNBRemoveProp) : vtc::Value(versions.back()));
  props.set("displayname", vtc::Value(dataclass));
  props.set("dataclassname", vtc::Value(dataclass));
  props.set("status", vtc::Value("normal"));
  return props;
}

bool NubiloRemoteSession::validPropertiesForDataclass(const std::string& dataclass) {
  vtc::Dictionary record = getDataclassInfo(dataclass);
  const vtc::Value* min = record.find("minversion");
  const vtc::Value* max = record.find("maxversion");
  if (min && max) {
    if (!changeLogExistsForDataclass(dataclass, min->integer())) return false;
    if (!changeLogExistsForDataclass(dataclass, max->integer())) return false;
    return !changeLogExistsForDataclass(dataclass, min->integer() - 1);
  }
  return changeLogVersionsForDataclass(dataclass).empty();
}

int64_t NubiloRemoteSession::calculateStorageConsumedForDataclass(const std::string& dataclass) {
  DavTransaction t = _TesselSession->_issuePropFindAtPath(dataclassPath(dataclass) + "/",
                                                          kDAVOneDepth, {kNBContentLength});
  if (!t.isSuccessful()) return 0;
  int64_t total = 0;
  for (const auto& [href, props] : t.result().dictionary())
    total += props.dictionary().get(kNBContentLength).integer();
  return total;
}

std::string NubiloRemoteSession::changeLogPathForDataclass(const std::string& dataclass,
                                                           int64_t index) const {
  return stringByAppendingTesselPathComponent(
      dataclassPath(dataclass), vtc::format("%05i.clog", static_cast<int32_t>(index)));
}

bool NubiloRemoteSession::changeLogExistsForDataclass(const std::string& dataclass, int64_t index) {
  return _TesselSession->basicAttributesAtPath(changeLogPathForDataclass(dataclass, index))
      .isSuccessful();
}
