// The WebDAV session to the user's share: every remote request of the library
// goes through one of these operations, all synchronous, each returning a
// DavTransaction. Paths are unescaped server paths; PROPFIND, PROPPATCH,
// DELETE and MOVE of a collection named without its trailing "/" follow the
// server's redirect to it (atCollectionPath). Held locks live in neon's
// lock store, so later requests under a locked resource carry its token.
// Not thread-safe: callers that share a session serialise on monitor().
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "VantorSyncManager/DavTransaction.h"
#include "VantorSyncManager/MemberAccount.h"
#include "VantorSyncManager/Value.h"

namespace vtc {
class DavConnection;
struct LockRecord;
// Keys of listing entries and attribute dictionaries beside kNBURI,
// kNBLastModified (a date) and kNBContentLength (an integer).
inline constexpr const char* kDavETag = "DAV:getetag";
inline constexpr const char* kDavIsCollection = "isCollection";
inline constexpr const char* kDavLockDiscovery = "DAV:lockdiscovery";
// Default duration of the plain lockResourceAtPath, in seconds.
inline constexpr int kDefaultLockSeconds = 240;
}  // namespace vtc

class TesselSession {
 public:
  // _initWithCredentials:owner:host:port:scheme:
  TesselSession(std::shared_ptr<MemberAccount> account, std::string owner, std::string host,
                int32_t port, std::string scheme);
  ~TesselSession();
  TesselSession(const TesselSession&) = delete;
  TesselSession& operator=(const TesselSession&) = delete;

  void setIsSynchronous(bool synchronous) { synchronous_ = synchronous; }
  void _setReadTimeOut(int32_t seconds);

  // The monitor of this session object; re-entrant.
  std::recursive_mutex& monitor() { return monitor_; }

  // Collections. _makeCollectionsAtPaths creates every path (and missing
  // parents); it succeeds when all of them exist afterwards.
  DavTransaction _makeCollectionsAtPaths(const std::vector<std::string>& paths);
  DavTransaction makeCollectionAtPath(const std::string& path,
                                      bool includingIntermediateCollections);
  DavTransaction deleteResourceAtPath(const std::string& path);

  // Locks (depth 0, exclusive, write). A lock of a missing resource, or of
  // one whose parent is missing, fails as not found (result 104, HTTP 404)
  // instead of leaving a lock-null resource; a server that creates the
  // resource anyway (201) has it deleted again (it made a file: a caller
  // about to make a collection there should make it before locking it). A
  // lock of a path whose earlier lock the server no longer knows sets that
  // lock's token aside and asks again. A granted lock is checked in the lock
  // discovery; one that the server gave to another client at the same moment
  // fails as locked (HTTP 423). Where the discovery drops the owner or the
  // time-out asked for, a lock record is kept beside the lock
  // (platform/dav/LockRecord.h); a lock refused because of another client's
  // lock that its record shows overdue is given back and asked for again. A
  // lock leaves the lock store only when an unlock succeeds or a new lock of
  // the same path replaces it: a refused relock or unlock keeps it.
  DavTransaction lockResourceAtPath(const std::string& path);
  DavTransaction unlockResourceAtPath(const std::string& path);
  DavTransaction _lockResourceAtPath(const std::string& path, double duration,
                                     const std::string& owner);
  DavTransaction _relockResourceAtPath(const std::string& path, double duration,
                                       const std::string& owner);
  DavTransaction _unlockResourceAtPath(const std::string& path);

  // PROPFIND: props are full names ("DAV:getetag", namespace + local name);
  // an empty list asks for all properties. The result maps each resource's
  // href, as the server sent it, to a dictionary from full property name to
  // text. A server that echoes the request's escaping keys the resource asked
  // for by vtc::davpath::escape(path); one that escapes otherwise, or sends
  // whole URLs, does not.
  DavTransaction _issuePropFindAtPath(const std::string& path, int32_t depth,
                                      const std::vector<std::string>& props, bool includingParent);
  DavTransaction _issuePropFindAtPath(const std::string& path, int32_t depth,
                                      const std::vector<std::string>& props);
  // PROPPATCH of local names in one namespace; a value equal to
  // kNBRemoveProp removes the property.
  DavTransaction _issuePropPatchAtPath(const std::string& path, const vtc::Dictionary& props,
                                       const std::string& nameSpace);

  // GET. The result is the body as data, or nothing when it went to
  // localDestination. A range is sent unless both ends are 0. A body in
  // memory may be as large as the limits' answer cap, one written to a file
  // as large as their changelog cap; a failed download to a file removes it.
  DavTransaction getDataAtPath(const std::string& path, std::optional<vtc::Date> ifModifiedSince,
                               int64_t rangeStart, int64_t rangeEnd,
                               const std::optional<std::string>& localDestination);
  DavTransaction getDataAtPath(const std::string& path);
  DavTransaction putData(const vtc::Bytes& data, const std::string& path);
  DavTransaction putLocalFileAtPath(const std::string& localPath, const std::string& path);

  // MOVE; without overwrite an existing target answers HTTP 412.
  DavTransaction moveResourceAtPath(const std::string& source, const std::string& destination,
                                    bool allowingOverwrite);
  DavTransaction moveResourceAtPath(const std::string& source, const std::string& destination);

  // Attributes: kNBURI, kNBLastModified, kNBContentLength, vtc::kDavETag,
  // vtc::kDavIsCollection; extended ones add vtc::kDavLockDiscovery, an array
  // of active locks with "owner" (the owner XML, whole), "token", "depth",
  // "timeout", "scope" and the fields of a sync lock owner record
  // ("lock-user", "clientid", "clientname", "acquiredate"). A lock whose
  // discovery lacks the owner takes token and owner from its lock record,
  // and is marked "recorded".
  DavTransaction basicAttributesAtPath(const std::string& path);
  DavTransaction extendedAttributesAtPath(const std::string& path);
  // The members of a collection (not the collection itself), as an array of
  // attribute dictionaries. The collection is asked for with its trailing "/".
  DavTransaction listCollectionAtPath(const std::string& path);

  // Stores a flattened sync report as "<reportsPath>/<name>.plist" (the
  // collection is made on first use).
  DavTransaction _sendReportingInfo(const vtc::Dictionary& report, const std::string& reportsPath,
                                    const std::string& name);

  const std::string& owner() const { return owner_; }
  // The SHA-256 digest of the HTTPS server's certificate; empty over HTTP.
  std::string serverCertificateDigest() const;
  bool isSynchronous() const { return synchronous_; }
  // Whether this session holds a lock on path in its lock store.
  bool holdsLockOnPath(const std::string& path) const;
  // The token of the lock held on path, or none.
  std::optional<std::string> lockTokenForPath(const std::string& path) const;
  // Gives back a lock known by its token alone (one left by a process that
  // ended without unlocking). Nothing is kept in the lock store.
  DavTransaction unlockResourceWithToken(const std::string& path, const std::string& token);

 private:
  DavTransaction propfind(const std::string& path, int32_t depth,
                          const std::vector<std::string>& props, bool includingParent);
  DavTransaction attributes(const std::string& path, int32_t depth, bool withLocks);
  DavTransaction mkcol(const std::string& path);
  // Sends a request for path through send, which takes the path to use. A
  // server that names a collection only with its trailing "/" (Apache's
  // mod_dir as Debian ships it) answers a request without it with a redirect
  // to the same path with the "/": the request is sent once more there, and
  // the path noted, so that later requests go there at once. Any other
  // redirect is returned as it was answered.
  DavTransaction atCollectionPath(const std::string& path,
                                  const std::function<DavTransaction(const std::string&)>& send);
  // Sends a request that adds or removes members of the parents of paths;
  // run builds and dispatches it, presenting the parents' locks when its
  // argument says so. They are presented, as servers that guard a locked
  // collection's members want; a server that refuses them (412 while such a
  // lock stands) is noted, and the request sent again without them.
  DavTransaction memberRequest(const std::string& method, const std::vector<std::string>& paths,
                               const std::function<int(bool)>& run);
  // The token of the lock this session holds on path's parent, or none.
  std::optional<std::string> parentLockToken(const std::string& path) const;
  // Whether the lock that this session holds on a parent of paths still
  // stands on the server.
  bool parentLockStands(const std::vector<std::string>& paths);
  // Whether a lock discovery (extended attributes) shows token as the only
  // lock; a discovery that hides tokens shows it as the one lock there is.
  static bool lockStands(const DavTransaction& discovery, const std::string& token);
  // After a granted lock: notes what the discovery dropped of the lock, and
  // keeps the lock record where the server needs one.
  void recordLockWhereNeeded(const std::string& path, const std::string& token,
                             const std::string& owner, long seconds, const DavTransaction& answer,
                             const DavTransaction& discovery);
  DavTransaction writeLockRecord(const std::string& path, const vtc::LockRecord& record);
  // On a server that keeps locks past their time-out: gives back the lock
  // that refused this session when its record shows it overdue by the
  // refusal's server time. True when it did.
  bool giveBackOverdueLock(const std::string& path, const DavTransaction& refusal);

  std::shared_ptr<MemberAccount> account_;
  std::shared_ptr<vtc::DavConnection> connection_;
  std::string owner_;
  bool synchronous_ = true;
  std::recursive_mutex monitor_;
  std::set<std::string> recordedLocks_;  // paths whose lock has a lock record
  std::set<std::string> slashedPaths_;   // collections met without their "/" (canonical)
};
