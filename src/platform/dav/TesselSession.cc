#include "platform/dav/TesselSession.h"

#include <ne_basic.h>

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
    return ne_move(connection_->session(), allowingOverwrite ? 1 : 0, from.c_str(), to.c_str());
  });
}

DavTransaction TesselSession::moveResourceAtPath(const std::string& source,
                                                 const std::string& destination) {
  return moveResourceAtPath(source, destination, true);
}
