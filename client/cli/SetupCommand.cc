// `setup URL --user NAME`: checks the share and says what it found there
// before it changes anything; only once every check has passed and the
// password is stored does it make the sync area, register this computer
// and store the account.
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <iostream>
#include <ostream>

#include "VantorSyncManager/HostIdentity.h"
#include "VantorSyncManager/NubiloException.h"
#include "VantorSyncManager/PublicNames.h"
#include "VantorSyncManager/VTCPrefsCenter.h"
#include "client/cli/Commands.h"
#include "client/cli/StatusText.h"
#include "client/cli/Terminal.h"
#include "client/run/Account.h"
#include "client/run/AccountKey.h"
#include "client/run/Automation.h"
#include "client/run/Collections.h"
#include "client/run/ServerQualification.h"
#include "client/run/SyncAreaFinding.h"
#include "client/run/SyncFailure.h"
#include "common/Clock.h"
#include "common/Format.h"
#include "common/SecretMemory.h"
#include "common/Uuid.h"
#include "platform/dav/DavPaths.h"
#include "platform/dav/TesselSession.h"
#include "platform/fs/LocalPaths.h"
#include "platform/sealing/KeyRecord.h"
#include "prefs/ClientConfiguration.h"

namespace vtc::client {

namespace {

std::string hostName() {
  char name[256] = {};
  if (::gethostname(name, sizeof name - 1) != 0 || !name[0]) return "Linux computer";
  return name;
}

// A password over plain http:// or mqtt:// only when the user says so, and
// then with a warning each time. True when it was allowed.
bool allowPlainPassword(const SetupRequest& request, const ServerAddress& server,
                        const std::optional<std::string>& push, Output& output) {
  std::string plain;
  if (server.plain()) plain = server.origin();
  if (push && push->starts_with("mqtt://")) plain += (plain.empty() ? "" : " and ") + *push;
  if (plain.empty()) return false;
  if (!request.allowInsecure)
    throw SyncFailure(FailureKind::Usage,
                      "Setup does not send a password over a plain connection (" + plain +
                          "): anyone on the way could read it. Use https:// (and mqtts://), or "
                          "say --allow-insecure to send it in the clear all the same.");
  output.err << "nubilosyncclient: warning: the password for " << request.member << " will cross "
             << plain << " in the clear (--allow-insecure); anyone on the network between can "
             << "read it.\n";
  return true;
}

std::string readSetupPassword(const SetupRequest& request, const ServerAddress& server) {
  if (request.passwordCommand) return passwordFromCommand(*request.passwordCommand);
  if (request.passwordFromStdin) {
    std::string line;
    if (std::getline(std::cin, line) && !line.empty() && line.back() == '\r') line.pop_back();
    if (line.empty()) throw SyncFailure(FailureKind::Usage, "No password came on standard input.");
    return line;
  }
  auto typed = readPassword("Password for " + request.member + " at " + server.url() + ": ");
  if (!typed || typed->empty()) throw SyncFailure(FailureKind::Usage, "No password was given.");
  return *typed;
}

// "Mac A, Mac B"; an encrypted account's names cannot be read before its
// key is open.
std::string names(const std::vector<AreaComputer>& computers) {
  std::string out;
  for (const AreaComputer& c : computers)
    out += (out.empty() ? "" : ", ") +
           (sealing::isSealedText(c.name) ? std::string("name encrypted") : c.name);
  return out;
}

// An encrypted account's key, opened (or for a new account made) before
// anything is stored, so that a wrong passphrase changes nothing. record:
// the new account's key record to store on the share, when made here.
std::optional<sealing::SecretKey> openAccountKey(const SetupRequest& request,
                                                 NubiloRemoteSession& session,
                                                 const SyncAreaFinding& found,
                                                 std::optional<Dictionary>& record) {
  std::optional<Dictionary> existing;
  if (found.kind == SyncAreaFinding::Kind::SyncArea) existing = readKeyRecord(session);
  if (existing) {
    std::string passphrase = readPassphrase(request.passphraseCommand, false);
    try {
      sealing::SecretKey key = unwrapWithPassphrase(*existing, passphrase);
      wipe(passphrase);
      return key;
    } catch (...) {
      wipe(passphrase);
      throw;
    }
  }
  if (!request.encrypt) return std::nullopt;
  if (found.kind == SyncAreaFinding::Kind::SyncArea) {
    const Array dataclasses = session.getAllDataclassInfo();
    for (const Value& d : dataclasses)
      if (d.dictionary().contains("maxversion"))
        throw SyncFailure(FailureKind::Usage,
                          "The sync area already holds data that is not encrypted; --encrypt "
                          "starts a new account only (in a new, empty sync area).");
  }
  std::string passphrase = readPassphrase(request.passphraseCommand, true);
  sealing::SecretKey key = sealing::SecretKey::random();
  record = sealing::wrapKey(key, passphrase);
  wipe(passphrase);
  return key;
}

// What setup found, in one sentence, before it changes anything. area and
// beside are addresses.
std::string findingSentence(const SyncAreaFinding& found, const std::string& member,
                            const std::string& area, const std::string& beside) {
  if (!found.startsNewArea()) {
    std::string s = "This computer joins the account of " + member + " on " + area;
    const size_t n = found.others.size();
    if (n == 0) return s + ", which no other computer uses yet.";
    s += ", used by " + std::to_string(n) + " other computer" + (n == 1 ? "" : "s") + " (" +
         names(found.others) + ")";
    std::optional<Date> last;
    for (const AreaComputer& c : found.others)
      if (c.lastSync && (!last || *c.lastSync > *last)) last = c.lastSync;
    if (!last)
      return s + (n == 1 ? ", which has not synced yet." : ", none of which has synced yet.");
    return s + ", last sync " + timeAgo(*last, currentClock().now()) + ".";
  }
  std::string why = "no sync area was found there";
  if (found.kind == SyncAreaFinding::Kind::OtherFolder)
    why = "the folder holds other files and no sync area";
  if (found.areaBeside) why += "; the share has one at " + beside;
  return "This computer starts a new, empty sync area at " + area + " (" + why + ").";
}

// This computer on the account: its client record, which must come back
// whole. Returns it as the share keeps it.
Dictionary registerComputer(NubiloRemoteSession& session, const std::string& guid,
                            const std::string& name, const std::string& url) {
  try {
    session.registerClient(guid, name);
  } catch (const NubiloException& e) {
    if (e.name() != NubiloClientRegistrationException) throw;  // already registered: fine
  }
  Dictionary record = session.getClientInfo(guid);
  if (record.get("guid").string() != guid)
    throw SyncFailure(FailureKind::ServerUnsuitable,
                      "The server at " + url +
                          " did not keep this computer's record on the account; syncing needs "
                          "a WebDAV server with dead properties (PROPPATCH).");
  return record;
}

// The configuration of setup's sessions: the built-in defaults, the
// address, the authority to trust (kept in caFile) and this computer.
Dictionary setupConfiguration(const SetupRequest& request, const ServerAddress& server,
                              const std::string& guid, const std::string& name, bool allowInsecure,
                              std::optional<std::string>& caFile) {
  Dictionary configuration = config::builtInDefaults(guid, request.member);
  configuration.merge(server.configurationKeys());
  if (request.caFile) {
    std::error_code error;
    const std::filesystem::path path =
        std::filesystem::absolute(paths::expandTilde(*request.caFile), error);
    if (error || !std::filesystem::is_regular_file(path))
      throw SyncFailure(FailureKind::Usage,
                        "There is no certificate file " + *request.caFile + ".");
    caFile = path.string();
    configuration.set("tls_ca_file", Value(*caFile));
  }
  configuration.set("ClientGuid", Value(guid));
  configuration.set("ClientName", Value(name));
  if (allowInsecure) configuration.set(kAllowInsecureKey, Value(true));
  return configuration;
}

// Says what setup found; a new area where none was expected goes on only
// when the user says so: --new, or yes at a terminal.
void sayWhatWasFound(const SetupRequest& request, const SyncAreaFinding& found,
                     const ServerAddress& server, const NubiloRemoteSession& session,
                     Output& output) {
  const std::string area = server.origin() + session.syncPath();
  const std::string beside =
      found.areaBeside ? server.origin() + server.shareRoot + *found.areaBeside : std::string();
  if (output.verbosity > 0)
    output.out << findingSentence(found, request.member, area, beside) << "\n" << std::flush;
  if (!found.unexpected() || request.newArea) return;
  const bool terminal = !request.passwordFromStdin && ::isatty(STDIN_FILENO);
  if (terminal && confirm("Start a new, empty sync area at " + area + "? [y/N] ")) return;
  throw SyncFailure(
      FailureKind::Usage,
      "There is no sync area at " + area +
          (found.areaBeside ? " (the share has one at " + beside + ")" : std::string()) +
          "; check the address, or say --new to start a new, empty one there.");
}

}  // namespace

int setupCommand(const SetupRequest& request, Output& output) {
  const ServerAddress server = ServerAddress::parse(request.url);
  if (request.member.empty())
    throw SyncFailure(FailureKind::Usage, "Give the member name with --user NAME.");
  std::optional<std::string> push;
  if (request.pushServer) push = checkedPushServer(*request.pushServer);
  const bool allowInsecure = allowPlainPassword(request, server, push, output);
  const std::string password = readSetupPassword(request, server);

  VTCPrefsCenter& prefs = VTCPrefsCenter::defaultCenter();
  // A computer set up before keeps its identity on the account.
  const std::string guid = prefs.clientGuid().value_or(makeUUIDString());
  const std::string name = prefs.clientName().value_or(hostName());
  std::optional<std::string> caFile;
  Dictionary configuration = setupConfiguration(request, server, guid, name, allowInsecure, caFile);

  // Looking only: nothing on the share changes until every check passed.
  checkShareRoot(request.member, password, configuration);
  configuration.set("create_sync_paths", Value(false));
  auto session = openSession(request.member, password, configuration);
  const SyncAreaFinding found = findSyncArea(*session, guid);
  sayWhatWasFound(request, found, server, *session, output);
  // An encrypted account's key is open before the checks, so that even
  // their lock owners carry this computer's name sealed.
  const SecretHold holdingKey;
  std::optional<Dictionary> newKeyRecord;
  std::optional<sealing::SecretKey> accountKey =
      openAccountKey(request, *session, found, newKeyRecord);
  std::shared_ptr<const sealing::AccountSeal> seal;
  if (accountKey)
    seal = std::make_shared<const sealing::AccountSeal>(
        sealing::SecretKey::fromBytes(ByteView(accountKey->data(), sealing::SecretKey::kSize)));
  session->setAccountSeal(seal);
  // The second client of the checks: another computer as far as the share
  // can tell.
  Dictionary otherConfiguration = configuration;
  const std::string otherGuid = makeUUIDString();
  otherConfiguration.set("guid", Value(otherGuid));
  otherConfiguration.set("ClientGuid", Value(otherGuid));
  otherConfiguration.set("ClientName", Value(name + " (setup check)"));
  // The probes go where the sync will write: the area, or before there is
  // one, the share's root.
  const std::string folder = found.kind == SyncAreaFinding::Kind::Missing
                                 ? davpath::collection(session->shareRoot())
                                 : session->syncPath();
  qualifyServer(
      *session,
      [&] {
        auto other = openSession(request.member, password, otherConfiguration);
        other->setAccountSeal(seal);
        return other;
      },
      folder, server.url());

  // Later sessions trust this certificate alone: one that changes is refused.
  AccountSetup setup{server,
                     request.member,
                     request.passwordCommand,
                     caFile,
                     session->tesselSession().serverCertificateDigest(),
                     allowInsecure};
  storePassword(setup, password);

  // Every check passed and the password is kept: the share changes now.
  configuration.erase("create_sync_paths");
  session = openSession(request.member, password, configuration);
  session->setAccountSeal(seal);
  if (accountKey) {
    if (newKeyRecord) writeKeyRecord(*session, *newKeyRecord);
    storeAccountKey(request.member, *accountKey, request.passwordCommand.has_value());
  } else {
    forgetAccountKey();
  }
  const Dictionary registered = registerComputer(*session, guid, name, server.url());
  // For the other computers' status: since when this one syncs, and which
  // report on the share is its own.
  Dictionary record;
  if (!registered.contains("firstsync"))
    record.set("firstsync", Value(textOf(Value(currentClock().now()))));
  if (auto machine = getHostUUIDString()) record.set("machineguid", Value(*machine));
  // A computer registered before the account was encrypted: its name too.
  if (seal) record.set("clientname", Value(seal->sealText(name, sealing::kClientNamePurpose)));
  session->patchClientInfo(record);
  storeAccount(setup, guid, name);
  if (push) storePushServer(*push);
  if (output.verbosity > 0) {
    output.out << "Set up " << request.member << " at " << server.url() << " for this computer, "
               << name << ".\n";
    if (configuredCollections().empty())
      output.out << "Add a folder with `nubilosyncclient add contacts FOLDER` or "
                 << "`nubilosyncclient add calendars FOLDER`, then run `nubilosyncclient sync`.\n";
    else
      output.out << "Its folders stay as they were; run `nubilosyncclient sync`.\n";
  }
  return 0;
}

}  // namespace vtc::client
