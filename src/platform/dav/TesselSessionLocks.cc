// LOCK, refresh and UNLOCK. Locks are depth 0: a collection lock guards the
// collection's properties and membership without colliding with the locks
// that other clients hold on its members.
#include <ne_alloc.h>
#include <ne_basic.h>
#include <ne_locks.h>
#include <ne_string.h>

#include <cmath>

#include "VantorSyncManager/StringAdditions.h"
#include "platform/dav/DavConnection.h"
#include "platform/dav/DavPaths.h"
#include "platform/dav/TesselSession.h"

namespace {

struct ne_lock* findLock(vtc::DavConnection& conn, const std::string& escapedPath) {
  ne_uri uri{};
  ne_fill_server_uri(conn.session(), &uri);
  uri.path = ne_strdup(escapedPath.c_str());
  struct ne_lock* lock = ne_lockstore_findbyuri(conn.lockStore(), &uri);
  ne_uri_free(&uri);
  return lock;
}

void forgetLock(vtc::DavConnection& conn, struct ne_lock* lock) {
  ne_lockstore_remove(conn.lockStore(), lock);
  ne_lock_destroy(lock);
}

long lockSeconds(double duration) {
  return std::max(1L, std::lround(duration));
}

DavTransaction notHeld(const std::string& method, const std::string& path) {
  DavTransaction t(method, path);
  t.setOutcome(false, 107, vtc::kNoHTTPStatus, 0);
  t.setErrorText("no lock held on this path");
  return t;
}

}  // namespace

DavTransaction TesselSession::_lockResourceAtPath(const std::string& path, double duration,
                                                  const std::string& owner) {
  std::string escaped = vtc::davpath::escape(path);
  struct ne_lock* lock = ne_lock_create();
  ne_fill_server_uri(connection_->session(), &lock->uri);
  lock->uri.path = ne_strdup(escaped.c_str());
  lock->depth = NE_DEPTH_ZERO;
  lock->scope = ne_lockscope_exclusive;
  lock->type = ne_locktype_write;
  lock->timeout = lockSeconds(duration);  // a lock without a time-out would never expire
  lock->owner = ne_strdup(owner.c_str());
  // Without If-Match the server would lock a missing resource into being.
  connection_->setExtraHeaders("If-Match: *\r\n");
  DavTransaction t =
      connection_->perform("LOCK", path, [&] { return ne_lock(connection_->session(), lock); });
  if (t.isSuccessful()) {
    if (struct ne_lock* old = findLock(*connection_, escaped)) forgetLock(*connection_, old);
    ne_lockstore_add(connection_->lockStore(), lock);
  } else {
    ne_lock_destroy(lock);
    if (t.httpStatusCode() == 412) t.setOutcome(false, 104, 404, t.transactionState());
  }
  return t;
}

DavTransaction TesselSession::_relockResourceAtPath(const std::string& path, double duration,
                                                    const std::string&) {
  std::string escaped = vtc::davpath::escape(path);
  struct ne_lock* lock = findLock(*connection_, escaped);
  if (!lock) return notHeld("LOCK", path);
  const long seconds = lockSeconds(duration);
  DavTransaction t = connection_->perform("LOCK", path, [&] {
    // A refresh carries no body; its depth must match the lock's, which
    // neon's own refresh leaves out.
    ne_request* req = ne_request_create(connection_->session(), "LOCK", escaped.c_str());
    ne_print_request_header(req, "If", "(<%s>)", lock->token);
    ne_print_request_header(req, "Timeout", "Second-%ld", seconds);
    ne_add_depth_header(req, lock->depth);
    int ret = vtc::dispatchExpectingSuccess(req);
    ne_request_destroy(req);
    return ret;
  });
  if (t.isSuccessful()) {
    lock->timeout = seconds;
  } else if (t.httpStatusCode() / 100 == 4) {
    // The server no longer knows the lock: stop presenting its token.
    forgetLock(*connection_, lock);
  }
  return t;
}

DavTransaction TesselSession::_unlockResourceAtPath(const std::string& path) {
  std::string escaped = vtc::davpath::escape(path);
  struct ne_lock* lock = findLock(*connection_, escaped);
  if (!lock) return notHeld("UNLOCK", path);
  DavTransaction t =
      connection_->perform("UNLOCK", path, [&] { return ne_unlock(connection_->session(), lock); });
  if (t.isSuccessful() || t.httpStatusCode() / 100 == 4) forgetLock(*connection_, lock);
  return t;
}

DavTransaction TesselSession::lockResourceAtPath(const std::string& path) {
  return _lockResourceAtPath(path, vtc::kDefaultLockSeconds, stringByXMLQuoting(owner_));
}

DavTransaction TesselSession::unlockResourceAtPath(const std::string& path) {
  return _unlockResourceAtPath(path);
}

bool TesselSession::holdsLockOnPath(const std::string& path) const {
  return findLock(*connection_, vtc::davpath::escape(path)) != nullptr;
}
