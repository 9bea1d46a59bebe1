#include "platform/dav/TesselSession.h"

#include <ne_207.h>
#include <ne_basic.h>
#include <ne_locks.h>

#include <set>

#include "VantorSyncManager/PublicNames.h"
#include "platform/dav/DavConnection.h"
#include "platform/dav/DavPaths.h"

TesselSession::TesselSession(std::shared_ptr<MemberAccount> account, std::string owner,
                             std::string host, int32_t port, std::string scheme)
    : account_(std::move(account)), owner_(std::move(owner)) {
  connection_ = account_->connectionTo(scheme, host, port);
}

TesselSession::~TesselSession() = default;

std::string TesselSession::serverCertificateDigest() const {
  return connection_->certificateDigest();
}

void TesselSession::_setReadTimeOut(int32_t seconds) {
  connection_->setReadTimeout(seconds);
}

DavTransaction TesselSession::mkcol(const std::string& path) {
  std::string escaped = vtc::davpath::escape(path);
  if (!escaped.ends_with('/')) escaped += '/';  // a collection's own name
  return memberRequest("MKCOL", {path}, [&](bool presentParent) {
    ne_request* req = ne_request_create(connection_->session(), "MKCOL", escaped.c_str());
    ne_lock_using_resource(req, escaped.c_str(), NE_DEPTH_ZERO);
    if (presentParent) ne_lock_using_parent(req, escaped.c_str());
    return ne_simple_request(connection_->session(), req);
  });
}

DavTransaction TesselSession::memberRequest(const std::string& method,
                                            const std::vector<std::string>& paths,
                                            const std::function<int(bool)>& run) {
  vtc::ServerTraits& traits = connection_->traits();
  bool presentParents = false;
  for (const std::string& path : paths) presentParents = presentParents || parentLockToken(path);
  presentParents = presentParents && traits.refusesParentTokens != true;
  DavTransaction t =
      connection_->perform(method, paths.front(), [&] { return run(presentParents); });
  // A 412 may be the server refusing the parents' tokens, or a precondition
  // of the request's own (Overwrite, If-Match, a stale token of its own).
  // Sent again without them while those locks stand: a server that guards
  // members refuses it for the lock, one that does not carries it out.
  if (presentParents && !traits.refusesParentTokens && t.httpStatusCode() == 412 &&
      parentLockStands(paths)) {
    DavTransaction again = connection_->perform(method, paths.front(), [&] { return run(false); });
    const int status = again.httpStatusCode();
    if (again.isSuccessful()) {
      traits.refusesParentTokens = true;
      return again;
    }
    if (status == 423 || status == 424 || status == 207) traits.refusesParentTokens = false;
  }
  return t;
}

std::optional<std::string> TesselSession::parentLockToken(const std::string& path) const {
  // The parent as it was locked: named with or without its trailing "/".
  const std::string parent = vtc::davpath::parent(path);
  if (auto token = lockTokenForPath(parent)) return token;
  return lockTokenForPath(vtc::davpath::canonical(parent));
}

bool TesselSession::parentLockStands(const std::vector<std::string>& paths) {
  for (const std::string& path : paths) {
    const std::optional<std::string> token = parentLockToken(path);
    if (token && lockStands(extendedAttributesAtPath(vtc::davpath::parent(path)), *token))
      return true;
  }
  return false;
}

DavTransaction TesselSession::makeCollectionAtPath(const std::string& path,
                                                   bool includingIntermediateCollections) {
  DavTransaction t = mkcol(path);
  // 409: a parent is missing. Make the parents first, then this one again.
  if (includingIntermediateCollections && t.httpStatusCode() == 409) {
    std::string parent = vtc::davpath::parent(path);
    if (parent != "/" && vtc::davpath::canonical(parent) != vtc::davpath::canonical(path)) {
      DavTransaction p = makeCollectionAtPath(parent, true);
      if (p.isSuccessful() || p.httpStatusCode() == 405) t = mkcol(path);
    }
  }
  return t;
}

DavTransaction TesselSession::_makeCollectionsAtPaths(const std::vector<std::string>& paths) {
  // One request in the usual case: a listing of the common parent shows that
  // every collection is there already.
  if (!paths.empty()) {
    const std::string parent = vtc::davpath::parent(paths.front());
    std::set<std::string> wanted;
    for (const std::string& path : paths)
      if (vtc::davpath::parent(path) == parent) wanted.insert(vtc::davpath::canonical(path));
    if (wanted.size() == paths.size()) {
      DavTransaction listing = listCollectionAtPath(parent);
      if (listing.isSuccessful()) {
        for (const vtc::Value& entry : listing.result().array())
          if (entry.dictionary().get(vtc::kDavIsCollection).boolean())
            wanted.erase(vtc::davpath::canonical(entry.dictionary().get(kNBURI).string()));
        if (wanted.empty()) {
          DavTransaction done("MKCOL", paths.back());
          done.setOutcome(true, 1, listing.httpStatusCode(), listing.transactionState());
          done.setResponseHeaders(listing._responseHeaders());
          return done;
        }
      }
    }
  }
  DavTransaction last("MKCOL", paths.empty() ? std::string() : paths.back());
  for (const std::string& path : paths) {
    last = makeCollectionAtPath(path, true);
    const bool exists = last.isSuccessful() || last.httpStatusCode() == 405;
    if (!exists) return last;
  }
  DavTransaction done("MKCOL", paths.empty() ? std::string() : paths.back());
  done.setOutcome(true, 1, last.httpStatusCode(),
                  paths.empty() ? vtc::kTransactionCompleted : last.transactionState());
  done.setResponseHeaders(last._responseHeaders());
  return done;
}

DavTransaction TesselSession::deleteResourceAtPath(const std::string& path) {
  return atCollectionPath(path, [&](const std::string& at) {
    const std::string escaped = vtc::davpath::escape(at);
    return memberRequest("DELETE", {at}, [&](bool presentParent) {
      ne_request* req = ne_request_create(connection_->session(), "DELETE", escaped.c_str());
      ne_lock_using_resource(req, escaped.c_str(), NE_DEPTH_INFINITE);
      if (presentParent) ne_lock_using_parent(req, escaped.c_str());
      ne_add_depth_header(req, NE_DEPTH_INFINITE);
      return ne_simple_request(connection_->session(), req);
    });
  });
}

DavTransaction TesselSession::moveResourceAtPath(const std::string& source,
                                                 const std::string& destination,
                                                 bool allowingOverwrite) {
  const std::string to = vtc::davpath::escape(destination);
  return atCollectionPath(source, [&](const std::string& at) {
    const std::string from = vtc::davpath::escape(at);
    return memberRequest("MOVE", {at, destination}, [&](bool presentParents) {
      ne_session* session = connection_->session();
      ne_request* req = ne_request_create(session, "MOVE", from.c_str());
      // A move takes the source out of its collection as well as adding the
      // target to another: both parents' locks must be presented (neon's own
      // MOVE presents only the target's).
      ne_lock_using_resource(req, from.c_str(), NE_DEPTH_INFINITE);
      ne_lock_using_resource(req, to.c_str(), NE_DEPTH_INFINITE);
      if (presentParents) {
        ne_lock_using_parent(req, from.c_str());
        ne_lock_using_parent(req, to.c_str());
      }
      ne_print_request_header(req, "Destination", "%s://%s%s", ne_get_scheme(session),
                              ne_get_server_hostport(session), to.c_str());
      ne_add_request_header(req, "Overwrite", allowingOverwrite ? "T" : "F");
      return ne_simple_request(session, req);
    });
  });
}

DavTransaction TesselSession::moveResourceAtPath(const std::string& source,
                                                 const std::string& destination) {
  return moveResourceAtPath(source, destination, true);
}
