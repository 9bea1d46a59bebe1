// The account this computer syncs with: where the share is, who the member
// is, how the password is found, and opening a session on it. A password is
// never an argument, never logged: it comes from the Secret Service or from
// the first line that a stored password command prints.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "VantorSyncManager/NubiloRemoteSession.h"
#include "VantorSyncManager/Value.h"

namespace vtc::client {

// http[s]://host[:port][/path]; the path, when given, is the sync area.
struct ServerAddress {
  std::string scheme;
  std::string host;
  int32_t port = 0;
  std::string syncPath;

  // Raises SyncFailure (Usage) with a sentence saying what is wrong.
  static ServerAddress parse(const std::string& url);
  std::string url() const;  // as the user would type it
  // The configuration keys it sets (host_scheme, host_name, host_port, and
  // sync_path when a path was given).
  Dictionary configurationKeys() const;
  // The address that a configuration's server keys name.
  static ServerAddress fromConfiguration(const Dictionary& configuration);
};

struct AccountSetup {
  ServerAddress server;
  std::string member;
  std::optional<std::string> passwordCommand;
  // HTTPS: the extra authority to trust, and the certificate that setup
  // accepted, which later sessions trust alone.
  std::optional<std::string> caFile;
  std::string certificateDigest;
};

// The first line the command prints (run with /bin/sh -c); raises
// SyncFailure (Login) when it fails or prints nothing.
std::string passwordFromCommand(const std::string& command);

// Opens a session for member and password with the given configuration,
// turning the library's failures into the client's plain sentences (a
// refused certificate: SyncFailure UntrustedCertificate).
std::unique_ptr<NubiloRemoteSession> openSession(const std::string& member,
                                                 const std::string& password,
                                                 Dictionary configuration);

// Stores the account after setup checked it: member name, server keys,
// certificate trust and the absence of a configuration server (per-user),
// this computer's client identity (per-host), the password (Secret Service,
// unless a command is given) and syncing on.
void storeAccount(const AccountSetup& setup, const std::string& password,
                  const std::string& clientGuid, const std::string& clientName);

// The stored member name and password; raises SyncFailure (Login) with a
// sentence saying how to set the account up.
std::pair<std::string, std::string> storedCredentials();

// The server's address as stored, for messages.
std::string storedServerURL();

}  // namespace vtc::client
