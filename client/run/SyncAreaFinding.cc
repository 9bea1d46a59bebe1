#include "client/run/SyncAreaFinding.h"

#include <algorithm>

#include "VantorSyncManager/PublicNames.h"
#include "client/run/SyncFailure.h"
#include "common/DateText.h"
#include "platform/dav/DavPaths.h"
#include "platform/dav/TesselSession.h"

namespace vtc::client {

namespace {

// Sibling folders looked into for a sync area: enough for a share that
// holds a few, never a walk through someone's files.
constexpr size_t kSiblingsLooked = 16;

bool isCollectionNamed(const Value& entry, const std::string& name) {
  const Dictionary& d = entry.dictionary();
  return d.get(kDavIsCollection).boolean() &&
         davpath::lastComponent(d.get(kNBURI).string()) == name;
}

bool holdsSyncArea(const Array& members) {
  auto has = [&](const char* name) {
    return std::any_of(members.begin(), members.end(),
                       [&](const Value& m) { return isCollectionNamed(m, name); });
  };
  return has("Clients") && has("Schemas");
}

std::vector<AreaComputer> computersOf(NubiloRemoteSession& session, const std::string& ownGuid) {
  const std::string& ns = session.syncNamespace();
  DavTransaction t = session._issuePropFindWithRetryAtPath(
      davpath::collection(session.clientsPath()), kDAVOneDepth,
      {ns + "guid", ns + "clientname", ns + "lastsync"}, false);
  std::vector<AreaComputer> computers;
  if (!t.isSuccessful()) return computers;
  for (const auto& [href, properties] : t.result().dictionary()) {
    const Dictionary& p = properties.dictionary();
    const std::string guid = p.get(ns + "guid").string();
    if (guid.empty() || guid == ownGuid) continue;
    AreaComputer c{p.get(ns + "clientname").string(), std::nullopt};
    if (c.name.empty()) c.name = guid;
    if (const Value* last = p.find(ns + "lastsync"))
      c.lastSync = dates::parse(last->string(), "yyyy-MM-dd HH:mm:ss ZZZ");
    computers.push_back(std::move(c));
  }
  std::sort(computers.begin(), computers.end(),
            [](const AreaComputer& a, const AreaComputer& b) { return a.name < b.name; });
  return computers;
}

// A sync area among the collections beside path, by its path in the share.
std::optional<std::string> areaBeside(NubiloRemoteSession& session, const std::string& path) {
  TesselSession& dav = session.tesselSession();
  DavTransaction listing = dav.listCollectionAtPath(davpath::parent(path));
  if (!listing.isSuccessful()) return std::nullopt;
  size_t looked = 0;
  for (const Value& entry : listing.result().array()) {
    const Dictionary& d = entry.dictionary();
    const std::string sibling = davpath::canonical(d.get(kNBURI).string());
    if (!d.get(kDavIsCollection).boolean() || sibling == davpath::canonical(path)) continue;
    if (++looked > kSiblingsLooked) break;
    if (dav.basicAttributesAtPath(sibling + "/Schemas/").isSuccessful() &&
        dav.basicAttributesAtPath(sibling + "/Clients/").isSuccessful()) {
      const std::string& root = session.shareRoot();
      return root == "/" ? sibling : sibling.substr(root.size());
    }
  }
  return std::nullopt;
}

}  // namespace

SyncAreaFinding findSyncArea(NubiloRemoteSession& session, const std::string& ownGuid) {
  SyncAreaFinding found;
  DavTransaction listing = session.tesselSession().listCollectionAtPath(session.syncPath());
  const int status = listing.httpStatusCode();
  if (listing.isSuccessful()) {
    const Array& members = listing.result().array();
    if (holdsSyncArea(members)) {
      found.kind = SyncAreaFinding::Kind::SyncArea;
      found.others = computersOf(session, ownGuid);
      return found;
    }
    found.kind =
        members.empty() ? SyncAreaFinding::Kind::EmptyFolder : SyncAreaFinding::Kind::OtherFolder;
  } else if (status != 404 && status != 409) {
    throw SyncFailure(FailureKind::ServerUnsuitable,
                      "The sync area " + session.syncPath() +
                          " cannot be read (PROPFIND answered " +
                          (status > 0 ? std::to_string(status) : std::string("nothing")) + ").");
  }
  found.areaBeside = areaBeside(session, session.syncPath());
  return found;
}

}  // namespace vtc::client
