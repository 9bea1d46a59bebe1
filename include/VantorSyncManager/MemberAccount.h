// A member account: the user's name and password for the share, and the
// check of those credentials against the server. Requests of the account and
// of every TesselSession made from it share one connection. While an account
// holds a password the process is not dumpable; the password is overwritten
// when the account goes.
#pragma once

#include <cstdint>
#include <memory>
#include <string>

#include "VantorSyncManager/DavTransaction.h"
#include "VantorSyncManager/Export.h"

namespace vtc {
class DavConnection;
class SecretHold;
}  // namespace vtc

// Told of every transaction an account completes.
class DavTransactionDelegate {
 public:
  virtual ~DavTransactionDelegate() = default;
  virtual void transactionCompleted(const DavTransaction& transaction) = 0;
};

class VSM_EXPORT MemberAccount {
 public:
  MemberAccount(std::string name, std::string password, std::string applicationID);
  ~MemberAccount();

  static std::shared_ptr<MemberAccount> accountWithName(std::string name, std::string password,
                                                        std::string applicationID);
  // The account stored in the user's preferences and credential store, or
  // nullptr when none is stored.
  static std::shared_ptr<MemberAccount> accountFromPreferencesWithApplicationID(
      const std::string& applicationID);

  void setIsSynchronous(bool synchronous) { synchronous_ = synchronous; }
  void setTransactionDelegate(DavTransactionDelegate* delegate) { delegate_ = delegate; }
  void setApplicationName(std::string name) { applicationName_ = std::move(name); }

  // Where the account's share is. There is no built-in service host here, so
  // the session names the server, a path under it to check the credentials
  // on, and the read time-out of its requests, before the first check.
  void setServer(std::string scheme, std::string host, int32_t port, std::string checkPath,
                 int32_t readTimeout = 0);

  // How HTTPS connections trust the server's certificate: the system's
  // authorities and caFile's (a PEM certificate) when given; only the
  // certificate whose SHA-256 digest ("aa:bb:...") is pinned, when one is.
  // Call before the first request.
  void setCertificateTrust(std::string caFile, std::string pinnedDigest);

  // A transaction whose result is a boolean: true when the server accepted
  // the credentials. A refusal (401), or a server certificate that the
  // trust refuses, is a successful transaction with false.
  DavTransaction credentialsAreValid();

  const std::string& name() const { return name_; }
  const std::string& password() const { return password_; }
  const std::string& applicationID() const { return applicationID_; }
  const std::string& applicationName() const { return applicationName_; }
  bool isSynchronous() const { return synchronous_; }

  // The connection to the server named by setServer (created on first use);
  // nullptr before setServer.
  std::shared_ptr<vtc::DavConnection> connection();
  // The connection to this endpoint: the account's own when it matches,
  // otherwise a new one with the account's credentials.
  std::shared_ptr<vtc::DavConnection> connectionTo(const std::string& scheme,
                                                   const std::string& host, int32_t port);

 private:
  std::string name_;
  std::string password_;
  std::string applicationID_;
  std::string applicationName_;
  bool synchronous_ = true;
  DavTransactionDelegate* delegate_ = nullptr;
  std::string scheme_, host_, checkPath_;
  int32_t port_ = 0;
  int32_t readTimeout_ = 0;
  std::string caFile_, pinnedDigest_;
  std::shared_ptr<vtc::DavConnection> connection_;
  std::unique_ptr<vtc::SecretHold> hold_;
};
