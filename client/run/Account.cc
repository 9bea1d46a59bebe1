#include "client/run/Account.h"

#include <cstdio>
#include <regex>

#include "VantorSyncManager/NubiloException.h"
#include "VantorSyncManager/PublicNames.h"
#include "VantorSyncManager/VTCPrefsCenter.h"
#include "client/run/FailureText.h"
#include "client/run/SyncFailure.h"
#include "platform/dav/DavConnection.h"
#include "platform/network/Reachability.h"
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
  while (!path.empty() && path.back() == '/') path.pop_back();
  const size_t last = path.rfind('/');
  if (last != std::string::npos) {
    a.shareRoot = path.substr(0, last);
    a.syncPath = path.substr(last);
  }
  return a;
}

std::string ServerAddress::origin() const {
  const bool usual = (scheme == "https" && port == 443) || (scheme == "http" && port == 80);
  return scheme + "://" + host + (usual ? "" : ":" + std::to_string(port));
}

std::string ServerAddress::url() const {
  return origin() + shareRoot + syncPath;
}

Dictionary ServerAddress::configurationKeys() const {
  Dictionary keys{{"host_scheme", scheme}, {"host_name", host}, {"host_port", port}};
  if (!shareRoot.empty()) keys.set("share_root", Value(shareRoot));
  if (!syncPath.empty()) keys.set("sync_path", Value(syncPath));
  return keys;
}

ServerAddress ServerAddress::fromConfiguration(const Dictionary& configuration) {
  ServerAddress a;
  a.scheme = configuration.get("host_scheme").string();
  a.host = configuration.get("host_name").string();
  a.port = static_cast<int32_t>(configuration.get("host_port").integer());
  a.shareRoot = configuration.get("share_root").string();
  while (!a.shareRoot.empty() && a.shareRoot.back() == '/') a.shareRoot.pop_back();
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

// "scheme://host:port", as failures name the server.
std::string serverOf(const Dictionary& configuration) {
  return configuration.get("host_scheme").string() + "://" +
         configuration.get("host_name").string() + ":" +
         std::to_string(configuration.get("host_port").integer());
}

// atSetup: the password was just given; else it is the stored one, which
// setup stores again.
SyncFailure passwordRefused(const std::string& where, const std::string& member, bool atSetup) {
  return SyncFailure(
      FailureKind::Login,
      "The server at " + where + " refused the password for " + member +
          (atSetup ? "; check the member name and the password, then run setup again."
                   : "; if it changed, store the new one with `nubilosyncclient setup " +
                         storedServerURL() + " --user " + member + "`."));
}

SyncFailure unreachable(const std::string& where, const std::string& why = {}) {
  return SyncFailure(FailureKind::Unreachable, "Cannot reach the server at " + where +
                                                   (why.empty() ? "" : " (" + why + ")") +
                                                   "; check the address and the network.");
}

// The server is asked for a connection first, briefly: one that is down is
// told at once, not after the retries the session gives a passing fault.
void requireReachable(const Dictionary& configuration, const std::string& where) {
  const int64_t port = configuration.get("host_port").integer();
  if (auto why = network::whyUnreachable(configuration.get("host_name").string(),
                                         static_cast<int>(port > 0 ? port : 443), 5.0)) {
    std::string reason = *why;
    if (!reason.empty()) reason[0] = static_cast<char>(std::tolower(reason[0]));
    throw unreachable(where, reason);
  }
}

}  // namespace

std::unique_ptr<NubiloRemoteSession> openSession(const std::string& member,
                                                 const std::string& password,
                                                 Dictionary configuration) {
  const std::string where = serverOf(configuration);
  requireReachable(configuration, where);
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
    if (e.name() == NubiloLoginFailureException) throw passwordRefused(where, member, false);
    if (e.name() == NubiloNetworkFailureException) throw unreachable(where);
    throw SyncFailure(failureKind(e), failureSentence("the account", e));
  }
}

void checkShareRoot(const std::string& member, const std::string& password,
                    const Dictionary& configuration) {
  const std::string where = serverOf(configuration);
  const ServerAddress server = ServerAddress::fromConfiguration(configuration);
  const std::string root = server.shareRoot + "/";
  auto account =
      MemberAccount::accountWithName(member, password, configuration.get("user_agent").string());
  account->setCertificateTrust(configuration.get("tls_ca_file").string(),
                               configuration.get("tls_pinned_certificate").string());
  const int64_t timeout = configuration.get("sync_dav_timeout_seconds").integer();
  account->setServer(server.scheme, server.host, server.port, root,
                     static_cast<int32_t>(timeout > 0 ? timeout : 90));
  const DavTransaction t = account->credentialsAreValid();
  if (auto connection = account->connection(); connection && connection->certificateRefusal())
    throw certificateFailure(*connection->certificateRefusal(), server, member,
                             connection->certificateDigest());
  const int status = t.httpStatusCode();
  if (status == 401) throw passwordRefused(where, member, true);
  if (t.transactionState() != kTransactionCompleted) throw unreachable(where);
  if (status == 207) return;
  std::string answer = "answered " + std::to_string(status) + " to PROPFIND at " + root;
  if (const Value* to = t._responseHeaders() ? t._responseHeaders()->find("Location") : nullptr)
    answer += " (a redirect to " + to->string() + ")";
  const std::string example =
      server.origin() + "/dav" + (server.syncPath.empty() ? "/sync" : server.syncPath);
  throw SyncFailure(FailureKind::ServerUnsuitable,
                    "The server at " + where + " " + answer +
                        ", so no WebDAV share begins there; the path of the address up to the "
                        "sync area must be where the share begins (for a share that Apache "
                        "serves with `Alias /dav /srv/dav`: " +
                        example + ").");
}

void storePassword(const AccountSetup& setup, const std::string& password) {
  if (setup.passwordCommand) return;
  std::string why;
  if (!secrets::storeGenericPassword(kCredentialService, setup.member, "Nubilo", password, &why))
    throw SyncFailure(FailureKind::Other,
                      "The password could not be stored in the Secret Service (" + why +
                          "); use --password-command on a computer without one.");
}

void storeAccount(const AccountSetup& setup, const std::string& clientGuid,
                  const std::string& clientName) {
  auto& store = PreferenceStore::shared();
  store.setValue(kAccountNameKey, Value(setup.member), kVantorDefaultsKey, Scope::AnyHost);
  for (const auto& [key, value] : setup.server.configurationKeys())
    store.setValue(key, value, kVantorDefaultsKey, Scope::AnyHost);
  // Keys an earlier setup may have left: the library's defaults apply.
  if (setup.server.shareRoot.empty())
    store.setValue("share_root", Value(), kVantorDefaultsKey, Scope::AnyHost);
  if (setup.server.syncPath.empty())
    store.setValue("sync_path", Value(), kVantorDefaultsKey, Scope::AnyHost);
  store.setValue(kAllowInsecureKey, setup.allowInsecure ? Value(true) : Value(), kVantorDefaultsKey,
                 Scope::AnyHost);
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

bool passwordCommandStored() {
  const Value command =
      PreferenceStore::shared().copyAppValue(kPasswordCommandKey, kVantorDefaultsKey);
  return command.isString() && !command.string().empty();
}

std::string storedServerURL() {
  ServerAddress a;
  a.scheme = perUser("host_scheme").string();
  a.host = perUser("host_name").string();
  a.port = static_cast<int32_t>(perUser("host_port").integer());
  a.shareRoot = perUser("share_root").string();
  a.syncPath = perUser("sync_path").string();
  if (a.scheme.empty() || a.host.empty()) return "URL";
  return a.url();
}

}  // namespace vtc::client
