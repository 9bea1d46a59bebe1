// `setup URL --user NAME`: checks the login and the share at once, then
// stores the account and turns syncing on.
#include <unistd.h>

#include <filesystem>
#include <iostream>
#include <ostream>

#include "VantorSyncManager/HostIdentity.h"
#include "VantorSyncManager/NubiloException.h"
#include "VantorSyncManager/PublicNames.h"
#include "VantorSyncManager/VTCPrefsCenter.h"
#include "client/cli/Commands.h"
#include "client/cli/Terminal.h"
#include "client/run/Account.h"
#include "client/run/ServerQualification.h"
#include "client/run/SyncFailure.h"
#include "common/Clock.h"
#include "common/Format.h"
#include "common/Uuid.h"
#include "platform/dav/TesselSession.h"
#include "prefs/ClientConfiguration.h"

namespace vtc::client {

namespace {

std::string hostName() {
  char name[256] = {};
  if (::gethostname(name, sizeof name - 1) != 0 || !name[0]) return "Linux computer";
  return name;
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

}  // namespace

int setupCommand(const SetupRequest& request, Output& output) {
  const ServerAddress server = ServerAddress::parse(request.url);
  if (request.member.empty())
    throw SyncFailure(FailureKind::Usage, "Give the member name with --user NAME.");
  std::string password;
  if (request.passwordCommand) {
    password = passwordFromCommand(*request.passwordCommand);
  } else if (request.passwordFromStdin) {
    std::string line;
    if (std::getline(std::cin, line) && !line.empty() && line.back() == '\r') line.pop_back();
    if (line.empty()) throw SyncFailure(FailureKind::Usage, "No password came on standard input.");
    password = line;
  } else {
    auto typed = readPassword("Password for " + request.member + " at " + server.url() + ": ");
    if (!typed || typed->empty()) throw SyncFailure(FailureKind::Usage, "No password was given.");
    password = *typed;
  }

  VTCPrefsCenter& prefs = VTCPrefsCenter::defaultCenter();
  // A computer set up before keeps its identity on the account.
  const std::string guid = prefs.clientGuid().value_or(makeUUIDString());
  const std::string name = prefs.clientName().value_or(hostName());
  Dictionary configuration = config::builtInDefaults(guid, request.member);
  configuration.merge(server.configurationKeys());
  std::optional<std::string> caFile;
  if (request.caFile) {
    std::error_code error;
    const std::filesystem::path path = std::filesystem::absolute(*request.caFile, error);
    if (error || !std::filesystem::is_regular_file(path))
      throw SyncFailure(FailureKind::Usage,
                        "There is no certificate file " + *request.caFile + ".");
    caFile = path.string();
    configuration.set("tls_ca_file", Value(*caFile));
  }
  configuration.set("ClientGuid", Value(guid));
  configuration.set("ClientName", Value(name));
  auto session = openSession(request.member, password, configuration);
  // The second client of the checks: another computer as far as the share
  // can tell.
  Dictionary otherConfiguration = configuration;
  const std::string otherGuid = makeUUIDString();
  otherConfiguration.set("guid", Value(otherGuid));
  otherConfiguration.set("ClientGuid", Value(otherGuid));
  otherConfiguration.set("ClientName", Value(name + " (setup check)"));
  qualifyServer(
      *session, [&] { return openSession(request.member, password, otherConfiguration); },
      server.url());
  const Dictionary registered = registerComputer(*session, guid, name, server.url());
  // For the other computers' status: since when this one syncs, and which
  // report on the share is its own.
  Dictionary record;
  if (!registered.contains("firstsync"))
    record.set("firstsync", Value(textOf(Value(currentClock().now()))));
  if (auto machine = getHostUUIDString()) record.set("machineguid", Value(*machine));
  session->patchClientInfo(record);

  // Later sessions trust this certificate alone: one that changes is refused.
  AccountSetup setup{server, request.member, request.passwordCommand, caFile,
                     session->tesselSession().serverCertificateDigest()};
  storeAccount(setup, password, guid, name);
  if (output.verbosity > 0)
    output.out << "Set up " << request.member << " at " << server.url() << " for this computer, "
               << name << ".\nAdd a folder with `nubilosyncclient add contacts FOLDER` or "
               << "`nubilosyncclient add calendars FOLDER`, then run `nubilosyncclient sync`.\n";
  return 0;
}

}  // namespace vtc::client
