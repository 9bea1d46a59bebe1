// One authenticated conversation with the user's WebDAV share: the member
// account, the WebDAV session, the layout of the sync area, the locking
// parameters and lock owner text, and the set of resources held locked.
// A session is driven from one thread; cancel() may be called from any.
#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "VantorSyncManager/DavTransaction.h"
#include "VantorSyncManager/Export.h"
#include "VantorSyncManager/MemberAccount.h"
#include "VantorSyncManager/NubiloChangeLog.h"
#include "VantorSyncManager/SyncEngineChange.h"
#include "VantorSyncManager/Value.h"

class TesselSession;
namespace vtc {
struct RetryTexts;
namespace sealing {
class AccountSeal;
}

// A changelog that was downloaded but not taken: an encrypted account's
// changelog that failed authentication, or one not encrypted at all.
struct RefusedChangeLog {
  std::string reason;       // "it failed authentication: ..."
  std::string creatorGuid;  // as its envelope names it (not authenticated)
};

// The entity tag of a dataclass record whose collection has none.
inline constexpr const char* kNoETag = "eTagNotFound";

// What fetchChangeLogsForDataclass brings back: the parsed changelogs by
// index, and "StorageConsumed", the number of bytes downloaded.
struct ChangeLogFetchResult {
  std::map<int64_t, std::unique_ptr<NubiloChangeLog>> changeLogs;
  int64_t StorageConsumed = 0;
  // By index: changelogs downloaded and set aside, never parsed.
  std::map<int64_t, RefusedChangeLog> refusedChangeLogs;
};
}  // namespace vtc

class VSM_EXPORT NubiloRemoteSession {
 public:
  // Writes the member name into configuration under "Name", creates the
  // account and initialises a session. Raises what initialisation raises.
  static std::unique_ptr<NubiloRemoteSession> sessionWithUsername(const std::string& username,
                                                                  const std::string& password,
                                                                  vtc::Dictionary& configuration);
  // A session for the account stored in preferences; raises
  // NubiloLoginFailureException when none is stored.
  static std::unique_ptr<NubiloRemoteSession> sessionFromPreferencesWithConfiguration(
      const vtc::Dictionary& configuration);

  // initWithVTMemberAccount:configuration: validates the credentials (with
  // retries), opens the WebDAV session and finds or creates the sync area
  // (unless "create_sync_paths" is false: a caller that looks first). Every
  // absolute path of the layout (the credential check, "sync_path", the
  // reset's trash) lies under "share_root", the server's root by default.
  // Raises NubiloLoginFailureException, NubiloNetworkFailureException or
  // NubiloTransactionFailureException; std::invalid_argument when the
  // configuration lacks "sync_path" or "host_name". No partly initialised
  // session is ever returned.
  NubiloRemoteSession(std::shared_ptr<MemberAccount> account, const vtc::Dictionary& configuration);

  // Unlocks every resource still held, then releases the members.
  ~NubiloRemoteSession();

  NubiloRemoteSession(const NubiloRemoteSession&) = delete;
  NubiloRemoteSession& operator=(const NubiloRemoteSession&) = delete;

  // Whether the clients and schemas collections exist (created if needed).
  bool createSyncPaths();
  // Deletes the whole sync area under a lock of its parent; raises
  // NubiloLockFailureException when that parent is locked.
  bool removeSyncPaths();
  void cancel() { _isCancelled = true; }
  bool isCancelled() const { return _isCancelled; }
  const std::string& eventUUID() const { return _sessionUUID; }

  // Writes the message-trace records of one failed or retried transaction.
  void messageTraceTransactionFailure(const DavTransaction& transaction, bool finalRetry,
                                      int64_t retryCount, const std::string& message);

  // Requests with retry. Each is issued once; a time-out (106) is tried once
  // more and that second answer returned as it is; for the gets a 404 is
  // tried once more after a pause (2 s, or 30 s for the path-only form).
  // A network failure (103) raises NubiloNetworkFailureException; every other
  // failure is returned for the caller to judge.
  DavTransaction _issuePropFindWithRetryAtPath(const std::string& path, int32_t depth,
                                               const std::vector<std::string>& props,
                                               bool includingParent);
  DavTransaction _issuePropFindWithRetryAtPath(const std::string& path, int32_t depth,
                                               const std::vector<std::string>& props);
  DavTransaction _issuePropPatchWithRetryAtPath(const std::string& path,
                                                const vtc::Dictionary& props,
                                                const std::string& nameSpace);
  DavTransaction getDataWithRetryAtPath(const std::string& path,
                                        std::optional<vtc::Date> ifModifiedSince,
                                        int64_t rangeStart, int64_t rangeEnd,
                                        const std::optional<std::string>& localDestination);
  DavTransaction getDataWithRetryAtPath(const std::string& path);
  // The same, the body written to a file instead of memory.
  DavTransaction getDataWithRetryAtPath(const std::string& path,
                                        const std::string& localDestination);
  DavTransaction putDataWithRetry(const vtc::Bytes& data, const std::string& path);
  DavTransaction moveResourceWithRetryAtPath(const std::string& source,
                                             const std::string& destination,
                                             bool allowingOverwrite);
  DavTransaction moveResourceWithRetryAtPath(const std::string& source,
                                             const std::string& destination);

  // Whether the dataclass's entity tag differs from previousETag (or cannot
  // be read). Weak and strong forms of one tag are the same tag.
  bool eTagChangedForDataclass(const std::string& dataclass, const std::string& previousETag);

  // Lock primitives. A lock is retried with a randomised, doubling pause of
  // at most 90 s and raises NubiloLockFailureException (with the resource's
  // attributes as information), NubiloNetworkFailureException or
  // NubiloResourceNotFoundException; a refused relock raises
  // NubiloRelockFailureException; a failed unlock is logged, never raised.
  void _lockResourceAtPath(const std::string& path);
  void _relockResourceAtPath(const std::string& path);
  void _unlockResourceAtPath(const std::string& path);

  // Named locks. Those without a client argument use the configuration's
  // "guid". lockClient raises NubiloClientRegistrationException for a client
  // that does not exist.
  void lockClient();
  void lockClient(const std::string& guid);
  void unlockClient();
  void unlockClient(const std::string& guid);
  void relockClient();
  void relockClient(const std::string& guid);
  void lockClients();
  void unlockClients();
  void relockClients();
  void lockDataclass(const std::string& dataclass);
  void unlockDataclass(const std::string& dataclass);
  void relockDataclass(const std::string& dataclass);
  void lockDataclasses();
  void unlockDataclasses();

  // Dataclass registry: one collection per dataclass under the schemas
  // collection, whose sync-namespace properties are its record.
  // getDataclassInfo registers an unknown dataclass; it raises
  // NubiloAccountExpiredException (402) or NubiloTransactionFailureException.
  vtc::Dictionary getDataclassInfo(const std::string& dataclass);
  vtc::Array getAllDataclassInfo();
  // The properties of a dataclass record and "DAV:getetag", asked for by
  // name wherever records are read: a server need not list dead properties
  // in an answer for all properties.
  std::vector<std::string> dataclassRecordProperties() const;
  std::vector<std::string> dataclassNames();
  void dumpDataclasses();
  bool registerDataclass(const std::string& dataclass);
  bool unregisterDataclass(const std::string& dataclass);
  // Empties the dataclass: moved aside in one request, or deleted changelog
  // by changelog when the move is refused. Always false.
  bool resetDataclass(const std::string& dataclass);
  bool setInfoForDataclass(const vtc::Dictionary& properties, const std::string& dataclass);
  bool validPropertiesForDataclass(const std::string& dataclass);
  vtc::Dictionary calculatePropertiesForDataclass(const std::string& dataclass);
  std::vector<std::string> changeLogVersionsForDataclass(const std::string& dataclass);
  int64_t calculateStorageConsumedForDataclass(const std::string& dataclass);

  // Client registry: one resource per client under the clients collection.
  // registerClient raises NubiloClientRegistrationException for a client
  // that exists; an empty guid or name is an assertion failure (false when
  // the assertion policy carries on).
  bool registerClient(const std::string& guid, const std::string& name);
  bool unregisterClient(const std::string& guid);
  vtc::Dictionary getClientInfo(const std::string& guid);
  vtc::Dictionary getClientInfo();
  vtc::Array getAllClientInfo();
  bool setInfoForClient(const vtc::Dictionary& properties, const std::string& guid);
  bool patchClientInfo(const vtc::Dictionary& properties);
  void setStatus(const std::string& status, const std::string& guid, const std::string& dataclass);
  void setOtherClientStatus(const std::string& status, const std::string& dataclass);
  void setAllClientStatus(const std::string& status, const std::string& dataclass);
  // The dataclass's own status; none removes it.
  void setStatus(const std::optional<std::string>& status, const std::string& dataclass);

  // Changelog transfer. The caller of commitChanges holds the dataclass lock
  // and passes the index one above the record's maxversion. The commit
  // uploads under a temporary name, publishes the new maxversion, then moves
  // the file into place without overwriting; a failed move is rolled back.
  // False only for an empty change list (nothing is sent). Raises
  // NubiloTesselFullException, NubiloNetworkFailureException,
  // NubiloTransactionFailureException or, when another client committed the
  // index first, NubiloServerIncoherencyException.
  bool commitChanges(const std::vector<SyncEngineChange>& changes, const std::string& dataclass,
                     int64_t index, bool reset);
  // Downloads the changelogs from..to in growing batches and parses them (from
  // 32768 bytes on, into mapped files). A 404 strictly inside the range or an
  // empty file raises NubiloCorruptChangelogException, any other failure
  // NubiloFailedToDownloadChangelogException; a cancelled session returns what
  // came before the cancellation.
  vtc::ChangeLogFetchResult fetchChangeLogsForDataclass(const std::string& dataclass, int64_t from,
                                                        int64_t to);
  // The raw bytes of one changelog; raises NubiloFailedToDownloadChangelogException.
  vtc::Bytes fetchChangeLogForDataclass(const std::string& dataclass, int64_t index);
  bool changeLogExistsForDataclass(const std::string& dataclass, int64_t index);
  // A plain PUT to the changelog's path; the outcome is not looked at.
  void uploadChangeLog(const vtc::Bytes& data, const std::string& dataclass, int64_t index);
  std::string changeLogPathForDataclass(const std::string& dataclass, int64_t index) const;
  // Copies minversion..maxversion into directory/dataclass/NNNNN.clog; write
  // failures are ignored, download failures raise.
  void downloadChangeLogsForDataclass(const std::string& dataclass, const std::string& directory);
  // Uploads every .clog under directory as the dataclass's content (after a
  // reset when clear is set), widens the record's versions to match and sets
  // every client's status. Takes and renews the dataclass and clients locks;
  // they are not released when an exception passes.
  void putChangeLogsFromDirectory(const std::string& directory, const std::string& dataclass,
                                  const std::string& status, bool clear);
  // Deletes the newest changelog, steps maxversion back and marks every
  // client "needstruth". False when the record has no maxversion.
  bool removeLastChangelogForDataclass(const std::string& dataclass);

  // Flattens a sync summary into a report of text values and stores it on the
  // share for the account's other computers; never raises, never judged.
  void sendReportingInfo(const vtc::Dictionary& summary);

  // Read access for callers and tests.
  TesselSession& tesselSession() { return *_TesselSession; }
  const vtc::Dictionary& configuration() const { return _configuration; }
  // The path on the server where the share begins: "/", or one without a
  // trailing "/" ("/dav").
  const std::string& shareRoot() const { return _shareRoot; }
  const std::string& syncPath() const { return _syncPath; }
  const std::string& clientsPath() const { return _clientsPath; }
  const std::string& schemasPath() const { return _schemasPath; }
  const std::string& syncNamespace() const { return _syncNamespace; }
  int64_t lockDuration() const { return _lockDuration; }
  int64_t maxLockAttempts() const { return _maxLockAttempts; }
  int64_t lockAcquireSleepInterval() const { return _lockAcquireSleepInterval; }
  const std::set<std::string>& lockedResources() const { return _lockedResources; }
  const std::string& lockOwnerFormatString() const { return _lockOwnerFormatString; }
  // The owner text of a lock taken now (the template stamped with the date).
  std::string lockOwnerText() const;
  const std::optional<std::string>& respondingServer() const { return _respondingServer; }

  // An encrypted account: from now on changelogs, reports, this client's
  // name (in its record and its lock owner) and the dataclasses' truth
  // digests are sealed on the way out and opened on the way in; a changelog
  // that does not open is refused (ChangeLogFetchResult::refusedChangeLogs).
  // Set before the first lock or commit.
  void setAccountSeal(std::shared_ptr<const vtc::sealing::AccountSeal> seal);
  const vtc::sealing::AccountSeal* accountSeal() const { return _accountSeal.get(); }

 protected:
  DavTransaction retrying(const vtc::RetryTexts& texts, const std::string& subject,
                          const std::function<DavTransaction()>& issue);
  std::string clientPath(const std::string& guid) const;
  std::string dataclassLockPath(const std::string& dataclass) const;
  std::string dataclassPath(const std::string& dataclass) const;
  // An absolute path of the layout ("/Web/...") as a path on the server,
  // under the share root.
  std::string pathInShare(const std::string& absolute) const;
  vtc::Dictionary recordFromProperties(const vtc::Dictionary& properties) const;
  // Client records at path (depth 0: the record; depth 1: the clients
  // collection's members). Asked for with all properties; where that answer
  // lacks a registered client's guid, asked again by name, and when that
  // finds it, by name from then on (the server leaves dead properties out).
  DavTransaction findClientRecords(const std::string& path, int32_t depth);
  // A client record's properties by name: its own, and the status and
  // version of each dataclass that this session has met.
  std::vector<std::string> clientRecordProperties() const;
  // The lock owner template from the configuration's client name (sealed
  // in an encrypted account).
  void makeLockOwnerFormat();

  std::shared_ptr<MemberAccount> _vantorAccount;
  std::unique_ptr<TesselSession> _TesselSession;
  vtc::Dictionary _configuration;
  std::string _shareRoot;
  std::string _syncPath;
  std::string _clientsPath;
  std::string _schemasPath;
  std::string _syncNamespace;
  size_t _namespaceLength = 0;
  int64_t _lockDuration = 0;
  int64_t _maxLockAttempts = 0;
  int64_t _lockAcquireSleepInterval = 0;
  std::set<std::string> _lockedResources;
  vtc::Dictionary _clientsInfo;
  std::string _lockOwnerFormatString;
  std::optional<std::string> _respondingServer;
  std::atomic<bool> _isCancelled{false};
  std::string _sessionUUID;
  std::set<std::string> _dataclassesMet;
  bool _clientRecordsByName = false;
  std::shared_ptr<const vtc::sealing::AccountSeal> _accountSeal;
};
