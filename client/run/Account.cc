#include "client/run/Account.h"

#include <cstdio>
#include <regex>

#include "VantorSyncManager/NubiloException.h"
#include "VantorSyncManager/PublicNames.h"
#include "VantorSyncManager/VTCPrefsCenter.h"
#include "client/run/SyncFailure.h"
#include "platform/dav/DavConnection.h"
#include "platform/prefs/PreferenceStore.h"
#include "platform/secrets/CredentialStore.h"
#include "platform/secrets/StoredAccount.h"
#include "prefs/ClientConfiguration.h"

namespace vtc::client {

namespace {

using prefs::PreferenceStore;
using prefs::Scope;

constexpr const char* kPasswordCommandKey = "PasswordCommand";

Value perUser(const std::string& key) {
  return PreferenceStore::shared().copyValue(key, kVantorDefaultsKey, Scope::AnyHost);
}

}  // namespace

ServerAddress ServerAddress::parse(const std::string& url) {
  static const std::regex form(
      R"(^(https?)://([^/:\s]+|\[[0-9A-Fa-f:.]+\])(?::(\d{1,5}))?(/.*)?$)");
  std::smatch m;
  if (!std::regex_match(url, m, form))
    throw SyncFailure(FailureKind::Usage, "\"" + url +
                                              "\" is not a server address; write it as "
                                              "http[s]://host[:port][/path].");
  ServerAddress a;
  a.scheme = m[1];
  a.host = m[2];
  a.port = m[3].matched ? std::stoi(m[3]) : (a.scheme == "https" ? 443 : 80);
  if (a.port < 1 || a.port > 65535)
    throw SyncFailure(FailureKind::Usage,
                      "The port in \"" + url + "\" is not between 1 and 65535.");
  std::string path = m[4].matched ? std::string(m[4]) : std::string();
  while (path.size() > 1 && path.back() == '/') path.pop_back();
  if (path != "/") a.syncPath = path;
  return a;
}

std::string ServerAddress::url() const {
  const bool usual = (scheme == "https" && port == 443) || (scheme == "http" && port == 80);
  return scheme + "://" + host + (usual ? "" : ":" + std::to_string(port)) + syncPath;
}

Dictionary ServerAddress::configurationKeys() const {
  Dictionary keys{{"host_scheme", scheme}, {"host_name", host}, {"host_port", port}};
  if (!syncPath.empty()) keys.set("sync_path", Value(syncPath));
  return keys;
}

ServerAddress ServerAddress::fromConfiguration(const Dictionary& configuration) {
  ServerAddress a;
  a.scheme = configuration.get("host_scheme").string();
  a.host = configuration.get("host_name").string();
  a.port = static_cast<int32_t>(configuration.get("host_port").integer());
  a.syncPath = configuration.get("sync_path").string();
  return a;
}

std::string passwordFromCommand(const std::string& command) {
  FILE* out = ::popen(command.c_str(), "r");
  if (!out) throw SyncFailure(FailureKind::Login, "The password command could not be started.");
  std::string line;
  char buffer[512];
  bool ended = false;
  while (!ended && std::fgets(buffer, sizeof buffer, out)) {
    line += buffer;
    ended = !line.empty() && line.back() == '\n';
  }
  // The rest of the output is not needed; reading it lets the command end.
  while (std::fgets(buffer, sizeof buffer, out)) {
  }
  const int status = ::pclose(out);
  while (!line.empty() && (line.back() == '\n' || line.back() == '\r')) line.pop_back();
  if (status != 0 || line.empty())
    throw SyncFailure(FailureKind::Login,
                      "The password command failed or printed nothing; check it with "
                      "`nubilosyncclient setup URL --user NAME --password-command CMD`.");
  return line;
}

namespace {

// The sentence for a certificate that the session's connection refused.
SyncFailure certificateFailure(CertificateRefusal refusal, const ServerAddress& server,
                               const std::string& member, const std::string& digest) {
  const std::string setup = "nubilosyncclient setup " + server.url() + " --user " + member;
  switch (refusal) {
    case CertificateRefusal::Changed:
      return SyncFailure(FailureKind::UntrustedCertificate,
                         "The server at " + server.url() +
                             " shows a certificate other than the one this computer accepted at "
                             "setup (its SHA-256 digest is now " +
                             digest +
                             "); if the server's certificate was renewed, check the new one, "
                             "then run `" +
                             setup + "` again to trust it.");
    case CertificateRefusal::Untrusted:
      return SyncFailure(FailureKind::UntrustedCertificate,
                         "The server at " + server.url() +
                             " has a certificate that no authority this computer trusts vouches "
                             "for; if the server has an authority of its own, give that "
                             "authority's certificate with `" +
                             setup + " --ca-file PATH`.");
    case CertificateRefusal::Invalid:
      break;
  }
  return SyncFailure(FailureKind::UntrustedCertificate,
                     "The server at " + server.url() +
                         " has a certificate that is expired, not yet valid, issued to another "
                         "name or badly chained; the server's certificate needs fixing.");
}

}  // namespace

std::unique_ptr<NubiloRemoteSession> openSession(const std::string& member,
                                                 const std::string& password,
                                                 Dictionary configuration) {
  const std::string where = configuration.get("host_scheme").string() + "://" +
                            configuration.get("host_name").string() + ":" +
                            std::to_string(configuration.get("host_port").integer());
  configuration.set("Name", Value(member));
  auto account =
      MemberAccount::accountWithName(member, password, configuration.get("user_agent").string());
  try {
    return std::make_unique<NubiloRemoteSession>(account, configuration);
  } catch (const NubiloException& e) {
    if (auto connection = account->connection(); connection && connection->certificateRefusal())
      throw certificateFailure(*connection->certificateRefusal(),
                               ServerAddress::fromConfiguration(configuration), member,
                               connection->certificateDigest());
    if (e.name() == NubiloLoginFailureException)
      throw SyncFailure(FailureKind::Login,
                        "The server at " + where + " refused the password for " + member +
                            "; store the right one with `nubilosyncclient setup`.");
    if (e.name() == NubiloNetworkFailureException)
      throw SyncFailure(FailureKind::Unreachable, "Cannot reach the server at " + where +
                                                      "; check the address and the network.");
    throw SyncFailure(FailureKind::Other,
                      "The server at " + where + " did not accept the session: " + e.reason());
  }
}

void storeAccount(const AccountSetup& setup, const std::string& password,
                  const std::string& clientGuid, const std::string& clientName) {
  auto& store = PreferenceStore::shared();
  store.setValue(kAccountNameKey, Value(setup.member), kVantorDefaultsKey, Scope::AnyHost);
  for (const auto& [key, value] : setup.server.configurationKeys())
    store.setValue(key, value, kVantorDefaultsKey, Scope::AnyHost);
  if (setup.server.syncPath.empty())
    store.setValue("sync_path", Value(), kVantorDefaultsKey, Scope::AnyHost);
  // A self-hosted share: no configuration server to download from.
  store.setValue(config::kConfigurationHostKey, Value(""), kVantorDefaultsKey, Scope::AnyHost);
  store.setValue(kPasswordCommandKey,
                 setup.passwordCommand ? Value(*setup.passwordCommand) : Value(),
                 kVantorDefaultsKey, Scope::AnyHost);
  store.setValue("tls_ca_file", setup.caFile ? Value(*setup.caFile) : Value(), kVantorDefaultsKey,
                 Scope::AnyHost);
  store.setValue("tls_pinned_certificate",
                 setup.certificateDigest.empty() ? Value() : Value(setup.certificateDigest),
                 kVantorDefaultsKey, Scope::AnyHost);
  store.synchronize(kVantorDefaultsKey, Scope::AnyHost);
  if (!setup.passwordCommand) {
    std::string why;
    if (!secrets::storeGenericPassword(kCredentialService, setup.member, "Nubilo", password, &why))
      throw SyncFailure(FailureKind::Other,
                        "The password could not be stored in the Secret Service (" + why +
                            "); use --password-command on a computer without one.");
  }
  VTCPrefsCenter& prefs = VTCPrefsCenter::defaultCenter();
  prefs.setClientGuid(clientGuid);
  prefs.setClientName(clientName);
  prefs.setSyncTurnedOn(true);
}

std::pair<std::string, std::string> storedCredentials() {
  auto member = storedMemberName();
  if (!member)
    throw SyncFailure(FailureKind::Login,
                      "No account is set up; run `nubilosyncclient setup URL --user NAME`.");
  // Per-host first: one computer of a shared home can keep its own.
  const Value command =
      PreferenceStore::shared().copyAppValue(kPasswordCommandKey, kVantorDefaultsKey);
  if (command.isString() && !command.string().empty())
    return {*member, passwordFromCommand(command.string())};
  std::string why;
  auto password = secrets::findGenericPassword(kCredentialService, *member, &why);
  if (!password)
    throw SyncFailure(FailureKind::Login, "No password for " + *member +
                                              " in the Secret Service (" + why +
                                              "); store it again with `nubilosyncclient setup " +
                                              storedServerURL() + " --user " + *member + "`.");
  return {*member, *password};
}

std::string storedServerURL() {
  ServerAddress a;
  a.scheme = perUser("host_scheme").string();
  a.host = perUser("host_name").string();
  a.port = static_cast<int32_t>(perUser("host_port").integer());
  a.syncPath = perUser("sync_path").string();
  if (a.scheme.empty() || a.host.empty()) return "URL";
  return a.url();
}

}  // namespace vtc::client
