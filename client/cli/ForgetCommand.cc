// `forget COMPUTER [--force]`: drops another computer of the account from
// the share (its client record, its report and any lock it left), for a
// computer that is gone. One seen syncing lately is refused unless forced:
// it would register itself again at its next sync anyway.
#include <chrono>
#include <ostream>

#include "VantorSyncManager/NubiloException.h"
#include "VantorSyncManager/NubiloRemoteSession.h"
#include "VantorSyncManager/PublicNames.h"
#include "VantorSyncManager/VTCPrefsCenter.h"
#include "client/cli/Commands.h"
#include "client/cli/TerminalText.h"
#include "client/run/Account.h"
#include "client/run/Collections.h"
#include "client/run/ForeignLocks.h"
#include "client/run/SyncFailure.h"
#include "common/Clock.h"
#include "common/DateText.h"
#include "platform/dav/TesselSession.h"
#include "session/SyncReport.h"

namespace vtc::client {

namespace {

constexpr auto kRecently = std::chrono::hours(24 * 7);

}  // namespace

int forgetCommand(const std::string& computer, bool force, Output& output) {
  VTCPrefsCenter& prefs = VTCPrefsCenter::defaultCenter();
  const auto [member, password] = storedCredentials();
  auto session = openSession(member, password, prefs.configuration());
  std::optional<Dictionary> found;
  for (const Value& client : session->getAllClientInfo()) {
    const Dictionary& c = client.dictionary();
    if (c.get("clientname").string() == computer || c.get("guid").string() == computer) {
      if (found)
        throw SyncFailure(FailureKind::Usage,
                          "More than one computer of the account is called " + computer +
                              "; name it by its identifier, as `nubilosyncclient status --json` "
                              "lists it.");
      found = c;
    }
  }
  if (!found)
    throw SyncFailure(FailureKind::Usage, "No computer of the account is called " + computer +
                                              "; `nubilosyncclient status` lists them.");
  const std::string guid = found->get("guid").string();
  if (guid == prefs.clientGuid().value_or(""))
    throw SyncFailure(FailureKind::Usage,
                      "That is this computer; to stop syncing here, remove its folders with "
                      "`nubilosyncclient remove NAME`.");
  const std::string name = found->get("clientname").string();
  const Value& lastSync = found->get("lastsync");
  std::optional<Date> seen;
  if (lastSync.isString()) seen = dates::parse(lastSync.string(), "yyyy-MM-dd HH:mm:ss ZZZ");
  if (!force && seen && currentClock().now() - *seen < kRecently)
    throw SyncFailure(FailureKind::Usage,
                      name + " synced on " + lastSync.string() +
                          ", within the last week; if it is gone for good, forget it with "
                          "`nubilosyncclient forget --force " +
                          computer + "`.");
  // Its locks first: a record under its lock cannot be removed.
  std::vector<std::string> paths{session->clientsPath() + "/" + guid + ".client",
                                 session->clientsPath() + "/"};
  for (const Collection& c : configuredCollections())
    paths.push_back(session->schemasPath() + "/" + c.dataclass + "/");
  size_t released = 0;
  for (const std::string& path : paths) released += releaseLocksOf(*session, path, guid);
  if (!session->unregisterClient(guid))
    throw SyncFailure(FailureKind::Other,
                      "The share did not let " + name + "'s record be removed; try again later.");
  const std::string machine = found->get("machineguid").string();
  if (!machine.empty())
    session->tesselSession().deleteResourceAtPath(reportsPathIn(session->syncPath()) + "/" +
                                                  machine + ".plist");
  if (output.verbosity > 0)
    output.out << "Forgot " << shownSafely(name)
               << (released ? " and gave back the locks it had left" : "")
               << "; if it syncs again, it joins as a new computer.\n";
  return 0;
}

}  // namespace vtc::client
