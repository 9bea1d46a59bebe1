#include "client/run/StatusReport.h"
#include "client/run/AccountKey.h"

#include <fstream>

#include "VantorSyncManager/NubiloException.h"
#include "VantorSyncManager/PublicNames.h"
#include "VantorSyncManager/SyncStatus.h"
#include "VantorSyncManager/VTCPrefsCenter.h"
#include "client/run/Account.h"
#include "client/run/Automation.h"
#include "client/run/Collections.h"
#include "client/run/DataclassSync.h"
#include "client/run/FailureText.h"
#include "client/run/ServerView.h"
#include "client/run/SupportFolder.h"
#include "platform/dav/DavPaths.h"
#include "platform/dav/TesselSession.h"
#include "platform/engine/SyncEngine.h"
#include "platform/fs/LocalPaths.h"
#include "platform/plist/PlistCodec.h"
#include "platform/prefs/PreferenceStore.h"
#include "session/SyncReport.h"

namespace vtc::client {

namespace {

std::optional<int> ownerPid() {
  if (!NubiloIsRunning()) return std::nullopt;
  auto folder = VTCPrefsCenter::applicationSupportDirectory();
  std::ifstream in(paths::join(folder.value_or(""), ".owner.pid"));
  int pid = 0;
  in >> pid;
  return pid > 0 ? std::optional<int>(pid) : std::nullopt;
}

// The reports on the share, by the machine they describe.
std::map<std::string, Dictionary> readReports(NubiloRemoteSession& session) {
  std::map<std::string, Dictionary> reports;
  const std::string folder = reportsPathIn(session.syncPath());
  DavTransaction listing = session.tesselSession().listCollectionAtPath(folder);
  for (const Value& entry : listing.result().array()) {
    const std::string path = entry.dictionary().get(kNBURI).string();
    if (!path.ends_with(".plist")) continue;
    DavTransaction got = session.tesselSession().getDataAtPath(path);
    if (!got.isSuccessful()) continue;
    // An encrypted account's reports open with its key; one that does not
    // is left out like one that is not a property list.
    std::optional<Bytes> opened;
    if (const sealing::AccountSeal* seal = session.accountSeal())
      opened = seal->open(got.result().data(), sealing::kReportPurpose);
    const Bytes& bytes = session.accountSeal() ? opened.value_or(Bytes{}) : got.result().data();
    if (auto report = plist::parse(bytes); report && report->isDictionary())
      reports[davpath::lastComponent(path).substr(0, davpath::lastComponent(path).size() - 6)] =
          report->dictionary();
  }
  return reports;
}

void askTheShare(StatusReport& status) {
  const auto [member, password] = storedCredentials();
  auto session = openSession(member, password, VTCPrefsCenter::defaultCenter().configuration());
  session->setAccountSeal(accountSeal(member));
  const ServerView view = ServerView::read(*session);
  const Dictionary own = session->getClientInfo();
  for (DataclassStatus& d : status.dataclasses) {
    if (auto record = view.record(d.name)) {
      d.minversion = record->minversion;
      d.maxversion = record->maxversion;
    }
    const Value& mine = own.get(d.name + ".status");
    if (mine.isString()) d.serverStatus = mine.string();
  }
  const auto reports = readReports(*session);
  for (const Value& client : session->getAllClientInfo()) {
    const Dictionary& c = client.dictionary();
    ComputerStatus computer{c.get("clientname").string(),
                            c.get("guid").string(),
                            c.get("guid").string() == status.computerGuid,
                            std::nullopt,
                            {}};
    if (c.get("lastsync").isString()) computer.lastSync = c.get("lastsync").string();
    // A computer without a host UUID stores its report under its guid.
    const std::string machine = c.get("machineguid").string();
    auto report = reports.find(machine.empty() ? c.get("guid").string() : machine);
    if (report != reports.end()) computer.report = report->second;
    status.computers.push_back(std::move(computer));
  }
}

}  // namespace

std::string lastErrorKey(const std::string& dataclass) {
  return "LastError." + dataclass;
}

std::string leftOverKey(const std::string& dataclass) {
  return "LeftOverItems." + dataclass;
}

StatusReport gatherStatus() {
  VTCPrefsCenter& prefs = VTCPrefsCenter::defaultCenter();
  StatusReport status;
  status.setUp = prefs.syncTurnedOn();
  status.computerName = prefs.clientName().value_or("");
  status.computerGuid = prefs.clientGuid().value_or("");
  status.member = prefs.username().value_or("");
  status.server = storedServerURL();
  status.runningPid = ownerPid();
  const AutomationState automation = automationState();
  status.scheduleOn = automation.scheduleOn;
  status.cadence = automation.cadence;
  status.nextScheduledSync = automation.nextScheduledSync;
  status.pushOn = automation.pushOn;
  status.pushServer = automation.pushServer;
  status.conflicts = ConflictStore().list();
  std::unique_ptr<engine::SyncEngine> engine;
  try {
    engine = engine::SyncEngine::open();
  } catch (const engine::EngineError&) {
    // Without the engine the item counts are unknown; the rest still stands.
  }
  for (const Collection& c : configuredCollections()) {
    DataclassStatus d;
    d.name = c.dataclass;
    d.kind = kindWord(c.kind);
    d.folder = c.folder;
    if (engine)
      d.items =
          static_cast<int64_t>(engine->itemStamps(folderClient(c.dataclass), c.dataclass).size());
    d.lastAttempt = prefs.lastAttemptedSyncDateForDataclass(c.dataclass);
    d.lastSuccess = prefs.lastSuccessfulSyncDateForDataclass(c.dataclass);
    d.failedCount = prefs.failedSyncCountForDataclass(c.dataclass);
    const Value error = prefs::PreferenceStore::shared().copyValue(
        lastErrorKey(c.dataclass), kVantorDefaultsKey, prefs::Scope::CurrentHost);
    if (error.isString()) d.lastError = error.string();
    const Value leftOver = prefs::PreferenceStore::shared().copyValue(
        leftOverKey(c.dataclass), kVantorDefaultsKey, prefs::Scope::CurrentHost);
    for (const Value& line : leftOver.array())
      if (line.isString()) d.leftOver.push_back(line.string());
    if (engine)
      for (const auto& [id, item] : engine->setAsideRecords(c.dataclass))
        d.leftOver.push_back("set aside " + item.file +
                             (item.origin.empty() ? "" : " (from " + item.origin + ")") + ": " +
                             item.reason + "; its bytes are in " +
                             paths::join(paths::join(supportFolder(), "SetAside"), c.dataclass));
    status.dataclasses.push_back(std::move(d));
  }
  if (!status.setUp) return status;
  try {
    askTheShare(status);
  } catch (const SyncFailure& e) {
    status.serverError = e.what();
    status.serverErrorKind = e.kind();
  } catch (const NubiloException& e) {
    status.serverError = failureSentence("the account", e);
    status.serverErrorKind = failureKind(e);
  }
  return status;
}

}  // namespace vtc::client
