#include "client/run/ServerQualification.h"

#include "VantorSyncManager/NubiloRemoteSession.h"
#include "VantorSyncManager/StringAdditions.h"
#include "client/run/SyncFailure.h"
#include "platform/dav/DavPaths.h"
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

// A redirect other than to the collection's own "/" (which the session
// follows): the server names itself otherwise than it was addressed.
void refuseRedirect(const DavTransaction& t, const std::string& url) {
  const int status = t.httpStatusCode();
  if (status < 300 || status > 399) return;
  const Value* to = t._responseHeaders() ? t._responseHeaders()->find("Location") : nullptr;
  refuse(url,
         "answers " + t.method().value_or("a request") + " of " + t.path() +
             " with a redirect to " + (to ? to->string() : std::string("nowhere")),
         "requests answered where they are sent: give setup the address that the server's "
         "redirects name, or let the server name itself as it is addressed (for Apache: "
         "UseCanonicalName Off, its default)");
}

std::string inFolder(const std::string& folder, const std::string& name) {
  const std::string f = davpath::canonical(folder);
  return f == "/" ? "/" + name : stringByAppendingTesselPathComponent(f, name);
}

// The probe resources, removed whatever the checks find.
class Probes {
 public:
  Probes(TesselSession& dav, const std::string& folder, const std::string& guid)
      : dav_(dav),
        folder_(folder),
        file_(inFolder(folder, guid + ".probe")),
        second_(inFolder(folder, guid + ".probe2")),
        collection_(inFolder(folder, guid + ".probe.d")),
        moved_(inFolder(folder, guid + ".probe.moved")) {}
  ~Probes() {
    // Left over only when the server refuses deletes as well; nothing else
    // reads them.
    for (const std::string& locked : {file_, davpath::collection(collection_)})
      if (dav_.holdsLockOnPath(locked)) dav_.unlockResourceAtPath(locked);
    for (const std::string& probe : {file_, second_, collection_, moved_})
      dav_.deleteResourceAtPath(probe);
  }
  const std::string& folder() const { return folder_; }
  const std::string& file() const { return file_; }
  const std::string& second() const { return second_; }
  // Named without its trailing "/", as a sync names some collections.
  const std::string& collection() const { return collection_; }
  const std::string& moved() const { return moved_; }

 private:
  TesselSession& dav_;
  std::string folder_, file_, second_, collection_, moved_;
};

bool keptProbe(const DavTransaction& find, const std::string& ns, const std::string& path) {
  if (!find.isSuccessful()) return false;
  for (const auto& [href, properties] : find.result().dictionary())
    if (davpath::canonical(davpath::fromHref(href)) == davpath::canonical(path) &&
        properties.dictionary().get(ns + "probe") == Value(kProbeValue))
      return true;
  return false;
}

void checkDeadProperties(NubiloRemoteSession& session, const Probes& probes,
                         const std::string& url) {
  TesselSession& dav = session.tesselSession();
  const std::string who = session.configuration().get("Name").string();
  DavTransaction put = dav.putData({}, probes.file());
  if (!put.isSuccessful())
    refuse(url, "does not let " + who + " write in " + probes.folder() + " (" + answerOf(put) + ")",
           "a share it can write");
  const std::string& ns = session.syncNamespace();
  DavTransaction patch =
      dav._issuePropPatchAtPath(probes.file(), Dictionary{{"probe", kProbeValue}}, ns);
  DavTransaction find = dav._issuePropFindAtPath(probes.file(), 0, {ns + "probe"});
  if (!patch.isSuccessful() || !keptProbe(find, ns, probes.file()))
    refuse(
        url,
        "does not keep WebDAV properties (" + answerOf(patch.isSuccessful() ? find : patch) + ")",
        "a WebDAV server with dead properties (PROPPATCH)");

  // A dataclass's record: the properties of a collection, asked for
  // without its "/" and listed with it.
  DavTransaction made = dav.makeCollectionAtPath(probes.collection(), false);
  if (!made.isSuccessful())
    refuse(url,
           "does not let " + who + " make collections in " + probes.folder() + " (" +
               answerOf(made) + ")",
           "a share it can write");
  patch = dav._issuePropPatchAtPath(probes.collection(), Dictionary{{"probe", kProbeValue}}, ns);
  find = dav._issuePropFindAtPath(probes.collection(), 0, {ns + "probe"});
  DavTransaction listing =
      dav._issuePropFindAtPath(davpath::collection(probes.collection()), 1, {ns + "probe"});
  for (const DavTransaction* t : {&patch, &find, &listing}) refuseRedirect(*t, url);
  if (!patch.isSuccessful() || !keptProbe(find, ns, probes.collection()) ||
      !keptProbe(listing, ns, probes.collection()))
    refuse(url,
           "does not keep WebDAV properties of collections (" +
               answerOf(!patch.isSuccessful()  ? patch
                        : !find.isSuccessful() ? find
                                               : listing) +
               ")",
           "a WebDAV server with dead properties (PROPPATCH) on collections");
}

void checkLocks(NubiloRemoteSession& session, NubiloRemoteSession& other, const Probes& probes,
                const std::string& url) {
  TesselSession& dav = session.tesselSession();
  const std::string& probe = probes.file();
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

  // A dataclass's lock: its collection, which the holder then writes in
  // and no one else may lock.
  const std::string collection = davpath::collection(probes.collection());
  lock = dav._lockResourceAtPath(collection, static_cast<double>(session.lockDuration()),
                                 session.lockOwnerText());
  if (!lock.isSuccessful())
    refuse(url, "does not lock collections (" + answerOf(lock) + ")",
           "WebDAV locks (class 2) of collections");
  second = theirs._lockResourceAtPath(collection, static_cast<double>(other.lockDuration()),
                                      other.lockOwnerText());
  if (second.isSuccessful()) {
    theirs.unlockResourceAtPath(collection);
    refuse(url, "does not enforce its WebDAV locks: another client could lock a locked collection",
           "locks that keep other clients out");
  }
  DavTransaction member =
      dav.putData({'1'}, stringByAppendingTesselPathComponent(probes.collection(), "00001.clog"));
  if (!member.isSuccessful())
    refuse(url,
           "does not let the holder of a collection's lock write in it (" + answerOf(member) + ")",
           "writes in a locked collection by the lock's holder");
  dav.unlockResourceAtPath(collection);
}

// A commit's move that must not overwrite, and a reset's move of a whole
// collection.
void checkMoves(TesselSession& dav, const Probes& probes, const std::string& url) {
  DavTransaction put = dav.putData({'2'}, probes.second());
  DavTransaction move = dav.moveResourceAtPath(probes.file(), probes.second(), false);
  DavTransaction target = dav.getDataAtPath(probes.second());
  const bool kept = target.isSuccessful() && target.result().data() == Bytes{'2'};
  if (!put.isSuccessful() || move.isSuccessful() || move.httpStatusCode() != 412 || !kept)
    refuse(url, "does not refuse a move onto an existing resource (" + answerOf(move) + ")",
           "a MOVE that refuses to overwrite (412) when told so");
  DavTransaction aside = dav.moveResourceAtPath(probes.collection(), probes.moved(), false);
  refuseRedirect(aside, url);
  if (!aside.isSuccessful())
    refuse(url, "does not move collections (" + answerOf(aside) + ")", "a MOVE of collections");
}

}  // namespace

void qualifyServer(NubiloRemoteSession& session,
                   const std::function<std::unique_ptr<NubiloRemoteSession>()>& other,
                   const std::string& folder, const std::string& url) {
  const std::string guid = session.configuration().get("ClientGuid").string();
  Probes probes(session.tesselSession(), folder, guid);
  checkDeadProperties(session, probes, url);
  std::unique_ptr<NubiloRemoteSession> second = other();
  checkLocks(session, *second, probes, url);
  checkMoves(session.tesselSession(), probes, url);
}

}  // namespace vtc::client
