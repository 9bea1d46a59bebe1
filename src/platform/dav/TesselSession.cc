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

void TesselSession::_setReadTimeOut(int32_t seconds) {
  connection_->setReadTimeout(seconds);
}

DavTransaction TesselSession::mkcol(const std::string& path) {
  std::string escaped = vtc::davpath::escape(path);
  return connection_->perform("MKCOL", path,
                              [&] { return ne_mkcol(connection_->session(), escaped.c_str()); });
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
  std::string escaped = vtc::davpath::escape(path);
  return connection_->perform("DELETE", path,
                              [&] { return ne_delete(connection_->session(), escaped.c_str()); });
}

DavTransaction TesselSession::moveResourceAtPath(const std::string& source,
                                                 const std::string& destination,
                                                 bool allowingOverwrite) {
  std::string from = vtc::davpath::escape(source);
  std::string to = vtc::davpath::escape(destination);
  return connection_->perform("MOVE", source, [&] {
    ne_session* session = connection_->session();
    ne_request* req = ne_request_create(session, "MOVE", from.c_str());
    // A move takes the source out of its collection as well as adding the
    // target to another: both parents' locks must be presented (neon's own
    // MOVE presents only the target's).
    ne_lock_using_resource(req, from.c_str(), NE_DEPTH_INFINITE);
    ne_lock_using_parent(req, from.c_str());
    ne_lock_using_resource(req, to.c_str(), NE_DEPTH_INFINITE);
    ne_lock_using_parent(req, to.c_str());
    ne_print_request_header(req, "Destination", "%s://%s%s", ne_get_scheme(session),
                            ne_get_server_hostport(session), to.c_str());
    ne_add_request_header(req, "Overwrite", allowingOverwrite ? "T" : "F");
    return ne_simple_request(session, req);
  });
}

DavTransaction TesselSession::moveResourceAtPath(const std::string& source,
                                                 const std::string& destination) {
  return moveResourceAtPath(source, destination, true);
}
