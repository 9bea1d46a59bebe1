// `setup URL --user NAME`: checks the login and the share at once, then
// stores the account and turns syncing on.
#include <unistd.h>

#include <iostream>
#include <ostream>

#include "VantorSyncManager/HostIdentity.h"
#include "VantorSyncManager/NubiloException.h"
#include "VantorSyncManager/PublicNames.h"
#include "VantorSyncManager/VTCPrefsCenter.h"
#include "client/cli/Commands.h"
#include "client/cli/Terminal.h"
#include "client/run/Account.h"
#include "client/run/SyncFailure.h"
#include "common/Clock.h"
#include "common/Format.h"
#include "common/Uuid.h"
#include "prefs/ClientConfiguration.h"

namespace vtc::client {

namespace {

std::string hostName() {
  char name[256] = {};
  if (::gethostname(name, sizeof name - 1) != 0 || !name[0]) return "Linux computer";
  return name;
}

// What syncing needs of the share beyond a login: properties that stay
// (the client record) and locks. Returns the client record as the share
// keeps it.
Dictionary qualify(NubiloRemoteSession& session, const std::string& guid, const std::string& name,
                   const std::string& url) {
  try {
    session.registerClient(guid, name);
  } catch (const NubiloException& e) {
    if (e.name() != NubiloClientRegistrationException) throw;  // already registered: fine
  }
  Dictionary record = session.getClientInfo(guid);
  if (record.get("guid").string() != guid)
    throw SyncFailure(FailureKind::ServerUnsuitable,
                      "The server at " + url +
                          " does not keep WebDAV properties (PROPPATCH); syncing needs a "
                          "WebDAV server with dead properties, such as Apache with mod_dav_fs.");
  try {
    session.lockClient(guid);
    session.unlockClient(guid);
  } catch (const NubiloException& e) {
    throw SyncFailure(
        FailureKind::ServerUnsuitable,
        "The server at " + url +
            " does not lock resources (WebDAV class 2); syncing needs locks: " + e.reason());
  }
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
  configuration.set("ClientGuid", Value(guid));
  configuration.set("ClientName", Value(name));
  auto session = openSession(request.member, password, configuration);
  const Dictionary registered = qualify(*session, guid, name, server.url());
  Dictionary record;
  if (!registered.contains("firstsync"))
    record.set("firstsync", Value(textOf(Value(currentClock().now()))));
  if (auto machine = getHostUUIDString()) record.set("machineguid", Value(*machine));
  session->patchClientInfo(record);

  AccountSetup setup{server, request.member, request.passwordCommand};
  storeAccount(setup, password, guid, name);
  if (output.verbosity > 0)
    output.out << "Set up " << request.member << " at " << server.url() << " for this computer, "
               << name << ".\nAdd a folder with `nubilosyncclient add contacts FOLDER` or "
               << "`nubilosyncclient add calendars FOLDER`, then run `nubilosyncclient sync`.\n";
  return 0;
}

}  // namespace vtc::client
