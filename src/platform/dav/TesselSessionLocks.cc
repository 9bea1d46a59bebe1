// LOCK, refresh and UNLOCK. Locks are depth 0: a collection lock guards the
// collection's properties and membership without colliding with the locks
// that other clients hold on its members.
#include <ne_alloc.h>
#include <ne_basic.h>
#include <ne_locks.h>
#include <ne_string.h>

#include <chrono>
#include <cmath>
#include <cstdlib>
#include <ctime>

#include "VantorSyncManager/PublicNames.h"
#include "common/Clock.h"
#include "platform/dav/DavConnection.h"
#include "platform/dav/DavPaths.h"
#include "platform/dav/LockRecord.h"
#include "platform/dav/TesselSession.h"
#include "platform/dav/XmlTree.h"

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

// The server's time of an answer (its Date header); the clock's when the
// answer has none.
std::optional<std::time_t> serverTimeOf(const DavTransaction& answer) {
  const vtc::Value* date =
      answer._responseHeaders() ? answer._responseHeaders()->find("Date") : nullptr;
  return vtc::serverTime(date ? date->string() : "");
}

std::time_t timeOf(const DavTransaction& answer) {
  return serverTimeOf(answer).value_or(
      std::chrono::system_clock::to_time_t(vtc::currentClock().now()));
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
    return memberRequest("LOCK", {path}, [&](bool presentParent) {
      // Built here rather than by neon's lock call, which marks the request
      // non-idempotent and so opens a new connection for every lock.
      ne_request* req = ne_request_create(connection_->session(), "LOCK", escaped.c_str());
      ne_set_request_body_buffer(req, body.data(), body.size());
      ne_add_request_header(req, "Content-Type", "application/xml");
      ne_add_depth_header(req, NE_DEPTH_ZERO);
      ne_print_request_header(req, "Timeout", "Second-%ld", seconds);
      // Without it the server would lock a missing resource into being.
      ne_add_request_header(req, "If-Match", "*");
      if (presentParent) ne_lock_using_parent(req, escaped.c_str());
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
  if (!t.isSuccessful() && t.httpStatusCode() == 423) {
    if (struct ne_lock* held = findLock(*connection_, escaped)) {
      // The server counts this session's own lock of the path against the
      // new one (some keep a lock after its resource was deleted): given
      // back, and asked for again.
      connection_->perform("UNLOCK", path, [&] { return ne_unlock(connection_->session(), held); });
      forgetLock(*connection_, held);
      recordedLocks_.erase(path);
      t = send();
    }
  }
  if (!t.isSuccessful() && t.httpStatusCode() == 423 && connection_->traits().ignoresLockTimeouts &&
      giveBackOverdueLock(path, t))
    t = send();
  if (t.isSuccessful()) {
    if (struct ne_lock* old = findLock(*connection_, escaped)) forgetLock(*connection_, old);
    recordedLocks_.erase(path);
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
    if (t.httpStatusCode() == 201) {
      // The server ignored If-Match and made the missing resource to lock
      // it. Under this lock no one else can have written it: it goes again.
      deleteResourceAtPath(path);
      connection_->perform("UNLOCK", path, [&] { return ne_unlock(connection_->session(), lock); });
      forgetLock(*connection_, lock);
      t.setOutcome(false, 104, 404, vtc::kTransactionCompleted);
      t.setErrorText("the resource to lock does not exist");
      return t;
    }
    DavTransaction discovery = extendedAttributesAtPath(path);
    if (!lockStands(discovery, token)) {
      // Given back in case the server kept it after all; an unknown token
      // is simply refused.
      connection_->perform("UNLOCK", path, [&] { return ne_unlock(connection_->session(), lock); });
      forgetLock(*connection_, lock);
      t.setOutcome(false, 153, 423, vtc::kTransactionCompleted);
      t.setErrorText("the server gave this lock to another client at the same moment");
    } else {
      recordLockWhereNeeded(path, token, owner, seconds, t, discovery);
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
// granted while only one is kept; others keep both. The lock discovery tells
// whose lock stands. A discovery that cannot be read proves nothing and
// counts as standing; one that hides tokens (or shows a token taken from a
// lock record, which may be an earlier holder's) can only show that there is
// one lock, which then is this one.
bool TesselSession::lockStands(const DavTransaction& discovery, const std::string& token) {
  const vtc::Value* locks = discovery.isSuccessful()
                                ? discovery.result().dictionary().find(vtc::kDavLockDiscovery)
                                : nullptr;
  if (!locks) return true;
  const vtc::Array& all = locks->array();
  if (all.size() != 1) return false;
  const vtc::Dictionary& lock = all.front().dictionary();
  const std::string shown = lock.get("recorded").boolean() ? "" : lock.get("token").string();
  return shown.empty() || shown == token;
}

void TesselSession::recordLockWhereNeeded(const std::string& path, const std::string& token,
                                          const std::string& owner, long seconds,
                                          const DavTransaction& answer,
                                          const DavTransaction& discovery) {
  vtc::ServerTraits& traits = connection_->traits();
  const vtc::Value* locks = discovery.isSuccessful()
                                ? discovery.result().dictionary().find(vtc::kDavLockDiscovery)
                                : nullptr;
  if (locks && locks->array().size() == 1) {
    const vtc::Dictionary& lock = locks->array().front().dictionary();
    if (!owner.empty() && (lock.get("recorded").boolean() || lock.get("owner").string().empty()))
      traits.dropsLockOwners = true;
    // "Second-N": an answer counts down from what was asked, never above it.
    const std::string timeout = lock.get("timeout").string();
    if (timeout.starts_with("Second-") && std::atol(timeout.c_str() + 7) > seconds)
      traits.ignoresLockTimeouts = true;
  }
  if (!traits.dropsLockOwners && !traits.ignoresLockTimeouts) return;
  // The record helps others; a lock without one still excludes them, so a
  // refused write only leaves the owner unknown and the lock to the
  // server's own time-out.
  if (writeLockRecord(path, vtc::LockRecord{token, timeOf(answer) + seconds, owner}).isSuccessful())
    recordedLocks_.insert(path);
}

DavTransaction TesselSession::writeLockRecord(const std::string& path,
                                              const vtc::LockRecord& record) {
  return _issuePropPatchAtPath(path, vtc::Dictionary{{vtc::kLockRecordName, record.text()}},
                               vtc::kLockRecordNamespace);
}

bool TesselSession::giveBackOverdueLock(const std::string& path, const DavTransaction& refusal) {
  // Only the server's own time can tell: the record holds the server's.
  const std::optional<std::time_t> now = serverTimeOf(refusal);
  if (!now) return false;
  DavTransaction t = extendedAttributesAtPath(path);
  const vtc::Value* text =
      t.isSuccessful() ? t.result().dictionary().find(vtc::kLockRecordProperty) : nullptr;
  const std::optional<vtc::LockRecord> record =
      text ? vtc::LockRecord::parse(text->string()) : std::nullopt;
  if (!record || record->expires >= *now) return false;
  return unlockResourceWithToken(path, record->token).isSuccessful();
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
  if (t.isSuccessful() && recordedLocks_.count(path) && connection_->traits().ignoresLockTimeouts) {
    // As at the lock: a record not renewed only lets others give the lock
    // back sooner, as a server that keeps time-outs would end it.
    writeLockRecord(path, vtc::LockRecord{lock->token, timeOf(t) + seconds, lock->owner});
  }
  return t;
}

DavTransaction TesselSession::_unlockResourceAtPath(const std::string& path) {
  std::string escaped = vtc::davpath::escape(path);
  struct ne_lock* lock = findLock(*connection_, escaped);
  if (!lock) return notHeld("UNLOCK", path);
  if (recordedLocks_.count(path)) {
    // Removed while the lock still guards it. Should that fail, the record
    // names a token that ends with this unlock: no one can give it back.
    _issuePropPatchAtPath(path, vtc::Dictionary{{vtc::kLockRecordName, kNBRemoveProp}},
                          vtc::kLockRecordNamespace);
  }
  DavTransaction t =
      connection_->perform("UNLOCK", path, [&] { return ne_unlock(connection_->session(), lock); });
  // Kept after a failure, so that a second try, or the release of the
  // session, still sends the token.
  if (t.isSuccessful()) {
    forgetLock(*connection_, lock);
    recordedLocks_.erase(path);
  }
  return t;
}

DavTransaction TesselSession::lockResourceAtPath(const std::string& path) {
  return _lockResourceAtPath(path, vtc::kDefaultLockSeconds, vtc::xmlEscape(owner_));
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
