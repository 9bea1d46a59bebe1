#include "client/run/ServerQualification.h"

#include "VantorSyncManager/NubiloRemoteSession.h"
#include "VantorSyncManager/StringAdditions.h"
#include "client/run/SyncFailure.h"
#include "platform/dav/TesselSession.h"

namespace vtc::client {

namespace {

constexpr const char* kProbeValue = "kept";

// "PROPPATCH answered 405", or what stood in for an answer.
std::string answerOf(const DavTransaction& t) {
  const std::string method = t.method().value_or("the request");
  if (t.httpStatusCode() > 0) return method + " answered " + std::to_string(t.httpStatusCode());
  return method + " got no answer";
}

[[noreturn]] void refuse(const std::string& url, const std::string& lacks,
                         const std::string& needs) {
  throw SyncFailure(FailureKind::ServerUnsuitable,
                    "The server at " + url + " " + lacks + "; syncing needs " + needs + ".");
}

// The probe resources, removed whatever the checks find.
class Probes {
 public:
  Probes(TesselSession& dav, std::string first, std::string second)
      : dav_(dav), first_(std::move(first)), second_(std::move(second)) {}
  ~Probes() {
    // Left over only when the server refuses deletes as well; nothing else
    // reads them.
    if (dav_.holdsLockOnPath(first_)) dav_.unlockResourceAtPath(first_);
    dav_.deleteResourceAtPath(first_);
    dav_.deleteResourceAtPath(second_);
  }
  const std::string& first() const { return first_; }
  const std::string& second() const { return second_; }

 private:
  TesselSession& dav_;
  std::string first_, second_;
};

void checkDeadProperties(NubiloRemoteSession& session, const std::string& probe,
                         const std::string& url) {
  TesselSession& dav = session.tesselSession();
  DavTransaction put = dav.putData({}, probe);
  if (!put.isSuccessful())
    refuse(url,
           "does not let " + session.configuration().get("Name").string() + " write in " +
               session.syncPath() + " (" + answerOf(put) + ")",
           "a share it can write");
  const std::string& ns = session.syncNamespace();
  DavTransaction patch = dav._issuePropPatchAtPath(probe, Dictionary{{"probe", kProbeValue}}, ns);
  DavTransaction find = dav._issuePropFindAtPath(probe, 0, {ns + "probe"});
  bool kept = false;
  if (find.isSuccessful())
    for (const auto& [href, properties] : find.result().dictionary())
      kept = kept || properties.dictionary().get(ns + "probe") == Value(kProbeValue);
  if (!patch.isSuccessful() || !kept)
    refuse(
        url,
        "does not keep WebDAV properties (" + answerOf(patch.isSuccessful() ? find : patch) + ")",
        "a WebDAV server with dead properties (PROPPATCH)");
}

void checkLocks(NubiloRemoteSession& session, NubiloRemoteSession& other, const std::string& probe,
                const std::string& url) {
  TesselSession& dav = session.tesselSession();
  DavTransaction lock = dav._lockResourceAtPath(probe, static_cast<double>(session.lockDuration()),
                                                session.lockOwnerText());
  if (!lock.isSuccessful())
    refuse(url, "does not lock resources (" + answerOf(lock) + ")",
           "WebDAV locks (class 2) that keep other clients out");

  // Another client may neither lock the resource nor write it.
  TesselSession& theirs = other.tesselSession();
  DavTransaction second = theirs._lockResourceAtPath(
      probe, static_cast<double>(other.lockDuration()), other.lockOwnerText());
  if (second.isSuccessful()) theirs.unlockResourceAtPath(probe);
  DavTransaction write = theirs.putData({'x'}, probe);
  if (second.isSuccessful() || write.isSuccessful())
    refuse(url,
           "does not enforce its WebDAV locks: another client could " +
               std::string(write.isSuccessful() ? "write" : "lock") + " a locked resource",
           "locks that keep other clients out");

  // And it can tell who holds it.
  DavTransaction seen = theirs.extendedAttributesAtPath(probe);
  const std::string guid = session.configuration().get("ClientGuid").string();
  bool named = false;
  if (const Value* locks = seen.result().dictionary().find(kDavLockDiscovery))
    for (const Value& held : locks->array())
      named = named || held.dictionary().get("clientid").string() == guid;
  if (!named)
    refuse(url, "does not say who holds a lock (the lock owner does not come back)",
           "locks whose owner other clients can read");
  dav.unlockResourceAtPath(probe);
}

void checkMoveWithoutOverwrite(TesselSession& dav, const Probes& probes, const std::string& url) {
  DavTransaction put = dav.putData({'2'}, probes.second());
  DavTransaction move = dav.moveResourceAtPath(probes.first(), probes.second(), false);
  DavTransaction target = dav.getDataAtPath(probes.second());
  const bool kept = target.isSuccessful() && target.result().data() == Bytes{'2'};
  if (!put.isSuccessful() || move.isSuccessful() || move.httpStatusCode() != 412 || !kept)
    refuse(url, "does not refuse a move onto an existing resource (" + answerOf(move) + ")",
           "a MOVE that refuses to overwrite (412) when told so");
}

}  // namespace

void qualifyServer(NubiloRemoteSession& session,
                   const std::function<std::unique_ptr<NubiloRemoteSession>()>& other,
                   const std::string& url) {
  const std::string guid = session.configuration().get("ClientGuid").string();
  Probes probes(session.tesselSession(),
                stringByAppendingTesselPathComponent(session.syncPath(), guid + ".probe"),
                stringByAppendingTesselPathComponent(session.syncPath(), guid + ".probe2"));
  checkDeadProperties(session, probes.first(), url);
  std::unique_ptr<NubiloRemoteSession> second = other();
  checkLocks(session, *second, probes.first(), url);
  checkMoveWithoutOverwrite(session.tesselSession(), probes, url);
}

}  // namespace vtc::client
