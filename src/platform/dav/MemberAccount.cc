#include "VantorSyncManager/MemberAccount.h"

#include <ne_basic.h>
#include <ne_props.h>

#include "common/SecretMemory.h"
#include "platform/dav/DavConnection.h"
#include "platform/dav/DavPaths.h"
#include "platform/secrets/StoredAccount.h"

MemberAccount::MemberAccount(std::string name, std::string password, std::string applicationID)
    : name_(std::move(name)),
      password_(std::move(password)),
      applicationID_(std::move(applicationID)),
      hold_(std::make_unique<vtc::SecretHold>()) {}

MemberAccount::~MemberAccount() {
  connection_.reset();
  vtc::wipe(password_);
}

std::shared_ptr<MemberAccount> MemberAccount::accountWithName(std::string name,
                                                              std::string password,
                                                              std::string applicationID) {
  return std::make_shared<MemberAccount>(std::move(name), std::move(password),
                                         std::move(applicationID));
}

std::shared_ptr<MemberAccount> MemberAccount::accountFromPreferencesWithApplicationID(
    const std::string& applicationID) {
  std::optional<std::string> name = vtc::storedMemberName();
  if (!name) return nullptr;
  std::optional<std::string> password = vtc::storedPassword(*name);
  if (!password) return nullptr;
  return accountWithName(*name, *password, applicationID);
}

void MemberAccount::setServer(std::string scheme, std::string host, int32_t port,
                              std::string checkPath, int32_t readTimeout) {
  vtc::DavEndpoint wanted{scheme, host, port};
  if (connection_ && !(connection_->endpoint() == wanted)) connection_.reset();
  scheme_ = std::move(scheme);
  host_ = std::move(host);
  port_ = port;
  checkPath_ = checkPath.empty() ? "/" : std::move(checkPath);
  readTimeout_ = readTimeout;
  if (connection_) connection_->setReadTimeout(readTimeout);
}

void MemberAccount::setCertificateTrust(std::string caFile, std::string pinnedDigest) {
  caFile_ = std::move(caFile);
  pinnedDigest_ = std::move(pinnedDigest);
  connection_.reset();  // a connection keeps the trust it was made with
}

std::shared_ptr<vtc::DavConnection> MemberAccount::connection() {
  if (host_.empty()) return nullptr;
  if (!connection_) {
    connection_ = std::make_shared<vtc::DavConnection>(
        vtc::DavEndpoint{scheme_, host_, port_}, name_, password_, applicationID_, readTimeout_,
        vtc::CertificateTrust{caFile_, pinnedDigest_});
  }
  return connection_;
}

std::shared_ptr<vtc::DavConnection> MemberAccount::connectionTo(const std::string& scheme,
                                                                const std::string& host,
                                                                int32_t port) {
  vtc::DavEndpoint wanted{scheme, host, port};
  if (auto own = connection(); own && own->endpoint() == wanted) return own;
  return std::make_shared<vtc::DavConnection>(wanted, name_, password_, applicationID_,
                                              readTimeout_,
                                              vtc::CertificateTrust{caFile_, pinnedDigest_});
}

DavTransaction MemberAccount::credentialsAreValid() {
  std::shared_ptr<vtc::DavConnection> conn = connection();
  if (!conn) {
    DavTransaction t("PROPFIND", checkPath_);
    t.setOutcome(false, 107, vtc::kNoHTTPStatus, 0);
    t.setErrorText("no server set for the account");
    return t;
  }
  // A depth-0 PROPFIND of one live property: any answer but 401 means the
  // server took the credentials (a 404 only says the path is not there yet).
  std::string escaped = vtc::davpath::escape(checkPath_);
  static const ne_propname kResourceType[] = {{"DAV:", "resourcetype"}, {nullptr, nullptr}};
  DavTransaction t = conn->perform("PROPFIND", checkPath_, [&] {
    return ne_simple_propfind(
        conn->session(), escaped.c_str(), NE_DEPTH_ZERO, kResourceType,
        [](void*, const ne_uri*, const ne_prop_result_set*) {}, nullptr);
  });
  const int status = t.httpStatusCode();
  if (conn->certificateRefusal()) {
    // A server whose certificate is refused gets no credentials, on this
    // check or any retry: they are as good as refused.
    t.setOutcome(true, 101, vtc::kNoHTTPStatus, vtc::kTransactionCompleted);
    t.setResult(vtc::Value(false));
  } else if (t.transactionState() == vtc::kTransactionCompleted &&
             (status == 401 || status == 404 || t.isSuccessful())) {
    t.setOutcome(true, status == 401 ? 101 : 1, status, t.transactionState());
    t.setResult(vtc::Value(status != 401));
  } else {
    t.setResult(vtc::Value(false));
  }
  if (delegate_) delegate_->transactionCompleted(t);
  return t;
}
