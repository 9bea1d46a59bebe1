// The session interface of an earlier design, kept so that older callers
// still load and run. Three things still work, on a NubiloRemoteSession:
// creating a session, registering and unregistering a client, and listing
// the account's clients. Every other member does nothing and returns a fixed
// value; the members that must no longer be used report an assertion failure
// (AssertionHandler.h) and, when the handler's policy carries on, return
// their fixed value. Members that answer with a status return 0 for success.
// Exceptions of the session (creation, registration, listing) pass to the
// caller. Objects are used from one thread.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "VantorSyncManager/Export.h"
#include "VantorSyncManager/Value.h"

class NubiloRemoteSession;

// One client's attributes: "clientname", "buildversion", "classname",
// "guid", "lastsync" and "firstsync" (dates) and "_properties" (a free
// dictionary). Movable, not copyable: a client made from DAV attributes
// shares that dictionary with its maker.
class VSM_EXPORT SMClientInfo {
 public:
  // initWith:build:andClass:andGuid: each attribute is stored only when given.
  SMClientInfo(const std::optional<std::string>& name, const std::optional<std::string>& build,
               const std::optional<std::string>& className, const std::optional<std::string>& guid);
  // initWithDAVAttributes: the dictionary itself, not a copy, holds the
  // attributes from now on.
  explicit SMClientInfo(std::shared_ptr<vtc::Dictionary> attributes);
  // A client of class "bramble" with this name, a fresh UUID as its guid and
  // no build version.
  static SMClientInfo defaultClientWithName(const std::string& name);

  SMClientInfo(SMClientInfo&&) noexcept;
  SMClientInfo& operator=(SMClientInfo&&) noexcept;
  SMClientInfo(const SMClientInfo&) = delete;
  SMClientInfo& operator=(const SMClientInfo&) = delete;
  ~SMClientInfo();

  // Each is nothing when the attribute is absent or of another kind.
  std::optional<std::string> name() const;
  std::optional<std::string> guid() const;
  std::optional<std::string> className() const;
  std::optional<std::string> buildVersion() const;
  std::optional<vtc::Date> lastSyncDate() const;
  std::optional<vtc::Date> firstSyncDate() const;
  std::optional<vtc::Dictionary> properties() const;
  // The attribute under any key, or a none value.
  const vtc::Value& valueForKey(const std::string& key) const;

  void setLastSyncDate(vtc::Date date);
  void setFirstSyncDate(vtc::Date date);
  void setProperties(const vtc::Dictionary& properties);

  // No longer functional: each reports an assertion failure and changes
  // nothing; versionForDataclass returns nothing.
  void setName(const std::string& name);
  std::optional<std::string> versionForDataclass(const std::string& dataclass) const;

 private:
  std::optional<std::string> text(const char* key) const;
  std::optional<vtc::Date> date(const char* key) const;

  std::shared_ptr<vtc::Dictionary> _clientInfo;
};

class VSM_EXPORT SMSession {
 public:
  // initWithCredentials:withPassword: a NubiloRemoteSession for this member
  // with the preference store's configuration. Raises what session creation
  // raises (NubiloLoginFailureException for wrong credentials, ...).
  SMSession(const std::string& username, const std::string& password);
  ~SMSession();
  SMSession(const SMSession&) = delete;
  SMSession& operator=(const SMSession&) = delete;

  // Creates a session and stores it in *session: 0 when one was stored, 1
  // when there was no slot for it. doLogin is ignored; failures raise.
  static int32_t configuredSessionForUsername(const std::string& username,
                                              const std::string& password,
                                              std::unique_ptr<SMSession>* session, bool doLogin);

  // Registration through the session (an existing client raises
  // NubiloClientRegistrationException; a client without guid or name is an
  // assertion failure). Always 0.
  int32_t registerClient(const SMClientInfo& client);
  int32_t unregisterClient(const SMClientInfo& client);

  // The account's clients. *clients is set to nothing first and receives
  // the list when it is not empty. The own client's last sync date is this
  // computer's last successful sync; the others' come from their records.
  // Always 0.
  int32_t getAccountClients(std::optional<std::vector<SMClientInfo>>* clients);

  // Inert: each does nothing and returns 0.
  int32_t login();
  int32_t logout();
  int32_t resetDataclass(const std::string& dataclass);
  int32_t resetClient(const SMClientInfo& client);
  int32_t unregisterDataclass(const std::string& dataclass);
  int32_t registerDataclass(const std::string& dataclass);
  int32_t updateClient(const SMClientInfo& client);
  int32_t getRegisteredClient(const std::string& guid, std::optional<SMClientInfo>* clientInfo);
  int32_t getChangeInfoForDataclass(const std::string& dataclass, int64_t sinceVersion,
                                    vtc::Array* changes);

  // Inert.
  static void setUsername(const std::string& username);
  static void setPassword(const std::string& password);
  static void setConfiguration(const vtc::Dictionary& configuration);

 private:
  std::unique_ptr<NubiloRemoteSession> _session;
};

// No longer functional: every member but the default constructor reports an
// assertion failure; syncMode then returns -1, the others nothing or 0.
class VSM_EXPORT SMDataclassInfo {
 public:
  SMDataclassInfo() = default;
  SMDataclassInfo(const std::string& name, const std::string& displayName);
  int64_t maxVersion() const;
  void setName(const std::string& name);
  int32_t syncMode() const;
  std::optional<vtc::Date> lastSyncDate() const;
};

// Inert: messages are neither shown nor translated any more.
class VSM_EXPORT SMResult {
 public:
  static void displayErrors(const std::vector<int32_t>& codes);
  static void displayError(int32_t code);
  static void displayErrorToUser(int32_t code);
  static void logError(int32_t code);
  static std::optional<std::string> localizedErrorFromCodeAndArgs(int32_t code, ...);
  static std::optional<std::string> localizedErrorFromCode(int32_t code);
  static std::optional<std::string> localizedString(const std::string& key,
                                                    const std::string& comment);
  static std::optional<std::string> localizedString(const std::string& key,
                                                    const std::string& comment,
                                                    const std::vector<std::string>& arguments);
  static std::optional<std::string> translatedMessageFromCode(int32_t code);
  static std::optional<std::string> localizedStringWithCode(int32_t code);
  static std::optional<std::string> localizedString(const std::string& key,
                                                    const std::vector<std::string>& subs);
  static std::optional<std::string> messageIdentifierFromCode(int32_t code,
                                                              const std::string& comment,
                                                              int32_t numberOfSubs);
  // 1, whatever the error.
  static int32_t resultCodeFromPosixError(int error);
};

// Kept for callers that still name them; they have no operations.
class VSM_EXPORT SyncStatusManager {
 public:
  SyncStatusManager();
  ~SyncStatusManager();
};

class VSM_EXPORT SMChangeLog {
 public:
  SMChangeLog();
  ~SMChangeLog();
};
