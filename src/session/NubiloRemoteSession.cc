#include "VantorSyncManager/NubiloRemoteSession.h"

#include <cstdlib>
#include <ctime>
#include <stdexcept>

#include "VantorSyncManager/NubiloException.h"
#include "VantorSyncManager/PublicNames.h"
#include "VantorSyncManager/StringAdditions.h"
#include "common/Clock.h"
#include "common/Logging.h"
#include "common/Uuid.h"
#include "platform/dav/DavPaths.h"
#include "platform/dav/TesselSession.h"
#include "platform/sealing/AccountSeal.h"

namespace {

constexpr const char* kLockOwnerTemplate =
    "<SY:synclockinfo xmlns:SY='%@'><SY:lock-user>%@</SY:lock-user><SY:clientid>%@</SY:clientid>"
    "<SY:clientname>%@</SY:clientname><SY:acquiredate>%@</SY:acquiredate></SY:synclockinfo>";

const std::string& requiredString(const vtc::Dictionary& configuration, const char* key) {
  const vtc::Value& v = configuration.get(key);
  if (!v.isString() || v.string().empty())
    throw std::invalid_argument(std::string("NubiloRemoteSession: the configuration has no \"") +
                                key + "\"");
  return v.string();
}

// "share_root" as "/" or a path without a trailing "/".
std::string shareRootOf(const vtc::Dictionary& configuration) {
  std::string root = vtc::davpath::canonical(configuration.get("share_root").string());
  if (root.empty()) return "/";
  return root.front() == '/' ? root : "/" + root;
}

// A first-run configuration has no time-out yet; without one a dead server
// would hold a request for ever.
int32_t readTimeout(const vtc::Dictionary& configuration) {
  int64_t seconds = configuration.get("sync_dav_timeout_seconds").integer();
  return static_cast<int32_t>(seconds > 0 ? seconds : 90);
}

}  // namespace

std::unique_ptr<NubiloRemoteSession> NubiloRemoteSession::sessionWithUsername(
    const std::string& username, const std::string& password, vtc::Dictionary& configuration) {
  configuration.set("Name", vtc::Value(username));
  auto account =
      MemberAccount::accountWithName(username, password, configuration.get("user_agent").string());
  return std::make_unique<NubiloRemoteSession>(std::move(account), configuration);
}

std::unique_ptr<NubiloRemoteSession> NubiloRemoteSession::sessionFromPreferencesWithConfiguration(
    const vtc::Dictionary& configuration) {
  const vtc::Value& userAgent = configuration.get("user_agent");
  auto account = MemberAccount::accountFromPreferencesWithApplicationID(userAgent.string());
  if (!account) {
    VTC_LOG_ERROR("Failed to obtain credentials from Preferences for %@, Raising exception",
                  userAgent);
    throw NubiloException(NubiloLoginFailureException, "Failed to obtain credentials");
  }
  return std::make_unique<NubiloRemoteSession>(std::move(account), configuration);
}

NubiloRemoteSession::NubiloRemoteSession(std::shared_ptr<MemberAccount> account,
                                         const vtc::Dictionary& configuration) {
  if (!account) throw std::invalid_argument("NubiloRemoteSession: no member account");
  // Checked before any request, so that a bad configuration never half-opens.
  const std::string& syncPath = requiredString(configuration, "sync_path");
  const std::string& hostName = requiredString(configuration, "host_name");
  std::string scheme = configuration.get("host_scheme").string();
  if (scheme.empty()) scheme = "https";
  int32_t port = static_cast<int32_t>(configuration.get("host_port").integer());
  if (port <= 0) port = scheme == "https" ? 443 : 80;

  // The lock retry pause draws from rand().
  std::srand(static_cast<unsigned>(std::time(nullptr)));
  _isCancelled = false;
  _configuration = configuration;
  _vantorAccount = std::move(account);
  _sessionUUID = vtc::makeUUIDString();

  const vtc::Value& name = _configuration.get("Name");
  _vantorAccount->setIsSynchronous(true);
  _vantorAccount->setTransactionDelegate(nullptr);
  _vantorAccount->setApplicationName("SyncWorks");
  // There is no built-in service host: the account checks its credentials
  // on the share that the configuration names, at its root, so that the
  // credentials then go with every request to the share (the trash of a
  // reset lies outside the sync area) instead of being asked for again.
  _shareRoot = shareRootOf(_configuration);
  _vantorAccount->setCertificateTrust(_configuration.get("tls_ca_file").string(),
                                      _configuration.get("tls_pinned_certificate").string());
  _vantorAccount->setServer(scheme, hostName, port, vtc::davpath::collection(_shareRoot),
                            readTimeout(_configuration));
  DavTransaction check = _vantorAccount->credentialsAreValid();

  _lockDuration = _configuration.get("lock_duration_seconds").integer();
  _maxLockAttempts = _configuration.get("max_lock_acquire_attempts").integer();
  _lockAcquireSleepInterval = _configuration.get("lock_acquire_sleep_seconds").integer();

  int64_t retries = 0;
  while (!check.isSuccessful() && retries < _maxLockAttempts) {
    ++retries;
    VTC_LOG_WARNING("Failed to validate credentials due to error %@, retrying...", check);
    vtc::currentSleeper().sleepFor(vtc::Seconds(static_cast<double>(_lockAcquireSleepInterval)));
    check = _vantorAccount->credentialsAreValid();
    messageTraceTransactionFailure(check, retries >= _maxLockAttempts, retries,
                                   "Timeout failure while validating credentials");
  }
  if (!check.isSuccessful()) {
    messageTraceTransactionFailure(check, true, retries, "Failure to validate credentials");
    std::string reason = vtc::format("Failed to validate credentials for %@", name);
    if (check.errorType() == kNBNetworkError) {
      VTC_LOG_ERROR("Failed to validate credentials due to NetworkError for %@, Raising exception",
                    name);
      throw NubiloException(NubiloNetworkFailureException, reason);
    }
    VTC_LOG_ERROR(
        "Failed to validate credentials due to Transaction failure for %@, Raising exception",
        name);
    throw NubiloException(NubiloTransactionFailureException, reason);
  }
  if (!check.result().boolean()) {
    VTC_LOG_ERROR("Failed to validate credentials for %@, Raising exception", name);
    throw NubiloException(NubiloLoginFailureException,
                          vtc::format("Failed to validate credentials for %@", name));
  }

  _TesselSession =
      std::make_unique<TesselSession>(_vantorAccount, name.string(), hostName, port, scheme);
  _TesselSession->setIsSynchronous(true);
  _TesselSession->_setReadTimeOut(readTimeout(_configuration));

  _syncPath = pathInShare(syncPath);
  _clientsPath = stringByAppendingTesselPathComponent(_syncPath, "Clients");
  _schemasPath = stringByAppendingTesselPathComponent(_syncPath, "Schemas");
  _syncNamespace = _configuration.get("sync_namespace").string();
  _namespaceLength = _syncNamespace.size();
  _lockedResources.clear();
  _clientsInfo.clear();

  makeLockOwnerFormat();

  // A failure here surfaces at the first request that needs the collections.
  const vtc::Value& create = _configuration.get("create_sync_paths");
  if (create.isNone() || create.boolean()) createSyncPaths();
}

void NubiloRemoteSession::makeLockOwnerFormat() {
  std::string client = vtc::textOf(_configuration.get("ClientName"));
  if (_accountSeal) client = _accountSeal->sealText(client, vtc::sealing::kClientNamePurpose);
  // The result still holds one "%@": the acquire date, stamped per lock.
  _lockOwnerFormatString =
      vtc::format(kLockOwnerTemplate, _syncNamespace,
                  stringByXMLQuoting(vtc::textOf(_configuration.get("Name"))),
                  _configuration.get("ClientGuid"), stringByXMLQuoting(client), "%@");
}

void NubiloRemoteSession::setAccountSeal(std::shared_ptr<const vtc::sealing::AccountSeal> seal) {
  _accountSeal = std::move(seal);
  makeLockOwnerFormat();
}

std::string NubiloRemoteSession::pathInShare(const std::string& absolute) const {
  return _shareRoot == "/" ? absolute : _shareRoot + absolute;
}

NubiloRemoteSession::~NubiloRemoteSession() {
  if (!_TesselSession) return;
  for (const std::string& path : _lockedResources) {
    VTC_LOG_WARNING("Resource %@ appears to still be locked when ending session, unlocking...",
                    path);
    _TesselSession->unlockResourceAtPath(path);  // one attempt; the result does not matter here
  }
}
