#include "client/run/Housekeeping.h"

#include <chrono>
#include <regex>
#include <vector>

#include "VantorSyncManager/NubiloException.h"
#include "VantorSyncManager/PublicNames.h"
#include "VantorSyncManager/StringAdditions.h"
#include "common/Clock.h"
#include "common/Logging.h"
#include "platform/dav/DavPaths.h"
#include "platform/dav/TesselSession.h"

namespace vtc::client {

namespace {

// The names a commit gives its upload ("00012.clog.<uuid>.tmp") and its
// changelogs ("00012.clog").
const std::regex kTemporaryChangelog("[0-9]+\\.clog\\.[0-9A-Fa-f-]{36}\\.tmp");
const std::regex kChangelog("([0-9]+)\\.clog");

void removeResource(NubiloRemoteSession& session, const std::string& path, const char* what) {
  DavTransaction t = session.tesselSession().deleteResourceAtPath(path);
  if (!t.isSuccessful() && t.httpStatusCode() != 404) {
    VTC_LOG_WARNING("Could not remove the %s %@ (next sync tries again): %@", what, path, t);
    return;
  }
  VTC_LOG_INFO("Removed the %s %@", what, path);
}

}  // namespace

void removeFolderLeftovers(const VdirCollection& folder) {
  folder.removeTemporaryLeftovers();
}

void removeShareLeftovers(NubiloRemoteSession& session, const std::string& dataclass,
                          const DataclassRecord& record) {
  const std::string collection =
      stringByAppendingTesselPathComponent(session.schemasPath(), dataclass);
  DavTransaction listing = session.tesselSession().listCollectionAtPath(collection);
  if (!listing.isSuccessful() || !listing.result().isArray()) {
    VTC_LOG_WARNING("Could not list %@ to look for leftovers: %@", collection, listing);
    return;
  }
  const Date now = currentClock().now();
  const auto lockLasts = std::chrono::seconds(session.lockDuration());
  std::vector<std::string> stale;
  std::vector<int64_t> below;
  bool minimumThere = false;
  for (const Value& entry : listing.result().array()) {
    if (!entry.isDictionary()) continue;
    const std::string name = davpath::lastComponent(entry.dictionary().get(kNBURI).string());
    std::smatch m;
    if (std::regex_match(name, kTemporaryChangelog)) {
      const Value& modified = entry.dictionary().get(kNBLastModified);
      if (modified.kind() == Value::Kind::Date && now - modified.date() > lockLasts)
        stale.push_back(name);
    } else if (record.minversion && std::regex_match(name, m, kChangelog) && m[1].length() <= 9) {
      const int64_t index = std::stoll(m[1]);
      if (index < *record.minversion) below.push_back(index);
      minimumThere = minimumThere || index == *record.minversion;
    }
  }
  for (const std::string& name : stale)
    removeResource(session, stringByAppendingTesselPathComponent(collection, name),
                   "temporary changelog of a commit cut short");
  if (!minimumThere || below.empty()) return;

  // As many as a compaction leaves: the locks are renewed on the way.
  VTC_LOG_INFO("Removing %d changelogs below minversion %d of %@", below.size(), *record.minversion,
               dataclass);
  const auto halfLock = std::chrono::duration_cast<Date::duration>(lockLasts) / 2;
  Date renewBy = currentClock().now() + halfLock;
  for (int64_t index : below) {
    if (currentClock().now() > renewBy) {
      try {
        session.relockDataclass(dataclass);
        session.relockClient();
      } catch (const NubiloException& e) {
        // The sync's own next step renews them too, and fails there.
        VTC_LOG_WARNING("Stopped removing old changelogs of %@: %@", dataclass, e);
        return;
      }
      renewBy = currentClock().now() + halfLock;
    }
    removeResource(session, session.changeLogPathForDataclass(dataclass, index),
                   "changelog below minversion");
  }
}

}  // namespace vtc::client
