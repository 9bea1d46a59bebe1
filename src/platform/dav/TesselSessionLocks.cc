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
  const long seconds = lockSeconds(duration);  // a lock without a time-out never expires
  const std::string body =
      "<?xml version=\"1.0\" encoding=\"utf-8\"?>\n<lockinfo xmlns='DAV:'><lockscope><exclusive/>"
      "</lockscope><locktype><write/></locktype><owner>" +
      owner + "</owner></lockinfo>\n";
  std::string token;
  auto send = [&] {
    return connection_->perform("LOCK", path, [&] {
      // Built here rather than by neon's lock call, which marks the request
      // non-idempotent and so opens a new connection for every lock.
      ne_request* req = ne_request_create(connection_->session(), "LOCK", escaped.c_str());
      ne_set_request_body_buffer(req, body.data(), body.size());
      ne_add_request_header(req, "Content-Type", "application/xml");
      ne_add_depth_header(req, NE_DEPTH_ZERO);
      ne_print_request_header(req, "Timeout", "Second-%ld", seconds);
      // Without it the server would lock a missing resource into being.
      ne_add_request_header(req, "If-Match", "*");
      ne_lock_using_parent(req, escaped.c_str());
      ne_lock_using_resource(req, escaped.c_str(), NE_DEPTH_ZERO);
      int ret = vtc::dispatchExpectingSuccess(req);
      if (ret == NE_OK) {
        const char* header = ne_get_response_header(req, "Lock-Token");
        token = header ? header : "";
        if (token.size() > 2 && token.front() == '<' && token.back() == '>')
          token = token.substr(1, token.size() - 2);
        if (token.empty()) {
          ne_set_error(connection_->session(), "LOCK answer without a lock token");
          ret = NE_ERROR;
        }
      }
      ne_request_destroy(req);
      return ret;
    });
  };
  DavTransaction t = send();
  if (!t.isSuccessful() && t.httpStatusCode() == 412) {
    // A precondition failed: the target is missing (If-Match) or the token of
    // an earlier lock of this path, sent in the If header, is one the server
    // no longer knows. Either way that lock is gone; without its token the
    // answer tells the two apart.
    if (struct ne_lock* stale = findLock(*connection_, escaped)) {
      forgetLock(*connection_, stale);
      t = send();
    }
  }
  if (t.isSuccessful()) {
    if (struct ne_lock* old = findLock(*connection_, escaped)) forgetLock(*connection_, old);
    struct ne_lock* lock = ne_lock_create();
    ne_fill_server_uri(connection_->session(), &lock->uri);
    lock->uri.path = ne_strdup(escaped.c_str());
    lock->depth = NE_DEPTH_ZERO;
    lock->scope = ne_lockscope_exclusive;
    lock->type = ne_locktype_write;
    lock->timeout = seconds;
    lock->token = ne_strdup(token.c_str());
    lock->owner = ne_strdup(owner.c_str());
    ne_lockstore_add(connection_->lockStore(), lock);
    if (!lockStands(path, token)) {
      // Given back in case the server kept it after all; an unknown token
      // is simply refused.
      connection_->perform("UNLOCK", path, [&] { return ne_unlock(connection_->session(), lock); });
      forgetLock(*connection_, lock);
      t.setOutcome(false, 153, 423, vtc::kTransactionCompleted);
      t.setErrorText("the server gave this lock to another client at the same moment");
    }
  } else if (t.httpStatusCode() == 412 || t.httpStatusCode() == 409) {
    // With no token of this path sent, a 412 is the If-Match failing; a 409
    // names a missing parent. Either way the target is not there.
    t.setOutcome(false, 104, 404, t.transactionState());
  }
  return t;
}

// Some servers (Apache's mod_dav_fs among them) check and record a lock in
// two steps, so two exclusive locks asked for at the same moment can both be
// granted while only one is kept. The lock discovery tells whose lock stands.
// A discovery that cannot be read proves nothing and counts as standing.
bool TesselSession::lockStands(const std::string& path, const std::string& token) {
  DavTransaction t = extendedAttributesAtPath(path);
  const vtc::Value* locks =
      t.isSuccessful() ? t.result().dictionary().find(vtc::kDavLockDiscovery) : nullptr;
  if (!locks) return true;
  for (const vtc::Value& lock : locks->array())
    if (lock.dictionary().get("token").string() != token) return false;
  return !locks->array().empty();
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
  // A refused renewal keeps the lock: it may still be held on the server,
  // and only an unlock that succeeds, or a new lock of the path, ends it here.
  if (t.isSuccessful()) lock->timeout = seconds;
  return t;
}

DavTransaction TesselSession::_unlockResourceAtPath(const std::string& path) {
  std::string escaped = vtc::davpath::escape(path);
  struct ne_lock* lock = findLock(*connection_, escaped);
  if (!lock) return notHeld("UNLOCK", path);
  DavTransaction t =
      connection_->perform("UNLOCK", path, [&] { return ne_unlock(connection_->session(), lock); });
  // Kept after a failure, so that a second try, or the release of the
  // session, still sends the token.
  if (t.isSuccessful()) forgetLock(*connection_, lock);
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

std::optional<std::string> TesselSession::lockTokenForPath(const std::string& path) const {
  struct ne_lock* lock = findLock(*connection_, vtc::davpath::escape(path));
  if (!lock || !lock->token) return std::nullopt;
  return std::string(lock->token);
}

DavTransaction TesselSession::unlockResourceWithToken(const std::string& path,
                                                      const std::string& token) {
  std::string escaped = vtc::davpath::escape(path);
  return connection_->perform("UNLOCK", path, [&] {
    ne_request* req = ne_request_create(connection_->session(), "UNLOCK", escaped.c_str());
    ne_print_request_header(req, "Lock-Token", "<%s>", token.c_str());
    int ret = vtc::dispatchExpectingSuccess(req);
    ne_request_destroy(req);
    return ret;
  });
}
