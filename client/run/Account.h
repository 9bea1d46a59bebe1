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

// http[s]://host[:port][/path]. The path's last component is the sync
// area; what comes before it is where the share begins on the server:
// "/dav/sync" is the area /sync of the share at /dav. Without a path the
// share is the server's root and the area the configuration's default.
struct ServerAddress {
  std::string scheme;
  std::string host;
  int32_t port = 0;
  std::string shareRoot;  // "" for the server's root, else "/dav"
  std::string syncPath;   // in the share ("/sync"); "" for the default

  // Raises SyncFailure (Usage) with a sentence saying what is wrong.
  static ServerAddress parse(const std::string& url);
  std::string url() const;     // as the user would type it
  std::string origin() const;  // scheme://host[:port]
  // Whether the password would cross the network in the clear.
  bool plain() const { return scheme == "http"; }
  // The configuration keys it sets (host_scheme, host_name, host_port,
  // share_root when the share is not the server's root, and sync_path when
  // a path was given).
  Dictionary configurationKeys() const;
  // The address that a configuration's server keys name.
  static ServerAddress fromConfiguration(const Dictionary& configuration);
};

// The per-user preference (and so configuration key) that says the user
// let setup send the password over plain http:// or mqtt:// (true), for
// the connections that send it later.
inline constexpr const char* kAllowInsecureKey = "allow_insecure";

struct AccountSetup {
  ServerAddress server;
  std::string member;
  std::optional<std::string> passwordCommand;
  // HTTPS: the extra authority to trust, and the certificate that setup
  // accepted, which later sessions trust alone.
  std::optional<std::string> caFile;
  std::string certificateDigest;
  bool allowInsecure = false;  // the password may cross plain connections
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

// Asks once, with no retries, whether the configuration's share root is a
// WebDAV collection that takes the password. Raises SyncFailure: Login for
// a refused password, Unreachable, UntrustedCertificate, and
// ServerUnsuitable with a sentence about the share root for any other
// answer (a server root that is no share answers 405 to PROPFIND).
void checkShareRoot(const std::string& member, const std::string& password,
                    const Dictionary& configuration);

// Stores the password where later runs find it: the Secret Service, unless
// a password command is given. Raises SyncFailure when it cannot.
void storePassword(const AccountSetup& setup, const std::string& password);

// Stores the account after setup checked it and stored the password:
// member name, server keys, certificate trust, the insecure allowance and
// the absence of a configuration server (per-user), this computer's client
// identity (per-host) and syncing on.
void storeAccount(const AccountSetup& setup, const std::string& clientGuid,
                  const std::string& clientName);

// The stored member name and password; raises SyncFailure (Login) with a
// sentence saying how to set the account up.
std::pair<std::string, std::string> storedCredentials();

// Whether this computer reads its password from a command.
bool passwordCommandStored();

// The server's address as stored, for messages.
std::string storedServerURL();

}  // namespace vtc::client
