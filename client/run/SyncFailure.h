// A failure of the sync client that ends a command: one plain sentence that
// says what to do, and the kind that sets the exit status.
#pragma once

#include <stdexcept>
#include <string>

namespace vtc::client {

enum class FailureKind {
  Other = 1,
  Usage = 2,
  Login = 3,                 // the server refused the member name or password
  Unreachable = 4,           // no answer from the server
  Busy = 5,                  // another sync of this user runs
  DeleteRefused = 6,         // the delete guard stopped the sync
  ServerUnsuitable = 7,      // the share lacks what syncing needs
  UntrustedCertificate = 8,  // the server's certificate is not one this computer trusts
  LeftOver = 9               // synced, but items were left over
};

class SyncFailure : public std::runtime_error {
 public:
  SyncFailure(FailureKind kind, const std::string& sentence)
      : std::runtime_error(sentence), kind_(kind) {}
  FailureKind kind() const { return kind_; }
  int exitStatus() const { return static_cast<int>(kind_); }

 private:
  FailureKind kind_;
};

}  // namespace vtc::client
