#include "client/run/SyncRun.h"
#include "client/run/AccountKey.h"

#include <unistd.h>

#include <chrono>
#include <memory>
#include <tuple>

#include "VantorSyncManager/Diagnostics.h"
#include "VantorSyncManager/HostIdentity.h"
#include "VantorSyncManager/NubiloException.h"
#include "VantorSyncManager/PublicNames.h"
#include "VantorSyncManager/SyncStatus.h"
#include "VantorSyncManager/VTCPrefsCenter.h"
#include "client/run/Account.h"
#include "client/run/Automation.h"
#include "client/run/CollectionMeta.h"
#include "client/run/FailureText.h"
#include "client/run/LockRenewal.h"
#include "client/run/SharedConflicts.h"
#include "client/run/StatusReport.h"
#include "client/run/SyncOwner.h"
#include "common/Clock.h"
#include "common/Format.h"
#include "common/Logging.h"
#include "common/SecretMemory.h"
#include "platform/network/PlainConnection.h"
#include "platform/prefs/PreferenceStore.h"
#include "platform/push/PushService.h"

namespace vtc::client {

namespace {

Dictionary summaryEntry(const DataclassOutcome& o, Date start, Date end, const std::string* error) {
  Dictionary entry{{"SyncDuration", std::chrono::duration<double>(end - start).count()},
                   {"SyncStart", Value(start)},
                   {"SyncEnd", Value(end)},
                   {"ClogCount", o.changelogsFetched},
                   {"SyncMode", o.mode}};
  if (error) entry.set("Error", Value(*error));
  return entry;
}

// For `status`: the last failure, and the files the last sync skipped or
// could not write (records set aside are in the engine).
void rememberOutcome(const DataclassOutcome& o, const std::string* sentence) {
  auto& store = prefs::PreferenceStore::shared();
  store.setValue(lastErrorKey(o.dataclass), sentence ? Value(*sentence) : Value(),
                 kVantorDefaultsKey, prefs::Scope::CurrentHost);
  Array leftOver;
  for (const auto& [file, why] : o.invalidFiles)
    leftOver.push_back(Value("skipped " + file + ": " + why));
  for (const std::string& failure : o.writeFailures)
    leftOver.push_back(Value("not written " + failure));
  store.setValue(leftOverKey(o.dataclass), leftOver.empty() ? Value() : Value(leftOver),
                 kVantorDefaultsKey, prefs::Scope::CurrentHost);
  store.synchronize(kVantorDefaultsKey, prefs::Scope::CurrentHost);
}

}  // namespace

std::string notSyncedSentence(const std::string& name) {
  std::string names;
  for (const Collection& c : configuredCollections())
    names += (names.empty() ? "" : ", ") + c.dataclass;
  if (names.empty())
    return name +
           " is not synced on this computer, nor is any other folder; add one with "
           "`nubilosyncclient add contacts|calendars FOLDER`.";
  return name + " is not synced on this computer; its synced folders are " + names + ".";
}

int RunResult::exitStatus() const {
  if (!failures.empty()) return static_cast<int>(failures.front().kind);
  for (const DataclassOutcome& o : outcomes)
    if (o.leftOver()) return static_cast<int>(FailureKind::LeftOver);
  return 0;
}

RunResult runSync(const RunRequest& request) {
  VTCPrefsCenter& prefs = VTCPrefsCenter::defaultCenter();
  if (!prefs.syncTurnedOn())
    throw SyncFailure(FailureKind::Usage,
                      "Syncing is not set up on this computer; run `nubilosyncclient setup URL "
                      "--user NAME`.");
  std::vector<Collection> collections;
  if (request.dataclasses.empty()) {
    collections = configuredCollections();
  } else {
    for (const std::string& name : request.dataclasses) {
      auto c = configuredCollection(name);
      if (!c) throw SyncFailure(FailureKind::Usage, notSyncedSentence(name));
      collections.push_back(*c);
    }
  }
  if (collections.empty())
    throw SyncFailure(FailureKind::Usage,
                      "No folder is synced yet; add one with `nubilosyncclient add "
                      "contacts|calendars FOLDER`.");

  auto owner = SyncOwner::acquire();
  const Date runStart = currentClock().now();
  const SecretHold holdingPassword;
  RunResult result;
  std::string member, password;
  std::unique_ptr<NubiloRemoteSession> session;
  try {
    std::tie(member, password) = storedCredentials();
    const ServerAddress server = ServerAddress::fromConfiguration(prefs.configuration());
    if (server.scheme != "https")
      if (auto warning = network::passwordInClearWarning(member, server.host, server.url(), "HTTP"))
        result.warnings.push_back(*warning);
    session = openSession(member, password, prefs.configuration());
    session->setAccountSeal(accountSeal(member));
  } catch (const SyncFailure& e) {
    // A run that never reached the share is still this computer's last
    // attempt: status tells when and why.
    if (!request.dryRun)
      for (const Collection& c : collections) {
        prefs.setLastAttemptedSyncDateForDataclass(c.dataclass);
        prefs.setSyncSuccessful(false, c.dataclass);
        DataclassOutcome none;
        none.dataclass = c.dataclass;
        const std::string sentence = e.what();
        rememberOutcome(none, &sentence);
      }
    throw;
  }
  HeldLocks locks(*session);
  if (!request.dryRun) locks.releaseLeftovers();
  auto engine =
      request.dryRun ? engine::SyncEngine::openInMemoryCopy() : engine::SyncEngine::open();
  getNubiloClient();  // registers this client with the engine

  std::vector<std::string> participants{kNetworkClient};
  for (const Collection& c : collections) participants.push_back(folderClient(c.dataclass));
  const int64_t plan = engine->beginSyncPlan(participants);
  engine->setSyncPlanStatus(plan, 7);

  SyncOptions options;
  options.dryRun = request.dryRun;
  options.maxDeletePercent = request.maxDeletePercent;
  options.deletesConfirmed = request.deletesConfirmed;
  options.repair = request.repair;
  LockRenewal renewal(*session, request.progress);
  options.progress = &renewal;
  options.computerName = prefs.clientName().value_or("this computer");
  ConflictStore conflicts;

  Dictionary summary{{"SyncType", request.periodic ? "periodic" : "manual"}};
  bool usedServer = false;
  try {
    ServerView view = ServerView::read(*session);
    for (const Collection& collection : collections) {
      const Date start = currentClock().now();
      if (!request.dryRun) prefs.setLastAttemptedSyncDateForDataclass(collection.dataclass);
      DataclassSync sync(*session, *engine, collection, options, conflicts, locks);
      std::optional<DataclassFailure> failure;
      DataclassOutcome outcome;
      outcome.dataclass = collection.dataclass;
      try {
        outcome = sync.run(view.record(collection.dataclass));
      } catch (const SyncFailure& e) {
        failure = DataclassFailure{collection.dataclass, e.what(), e.kind()};
      } catch (const NubiloException& e) {
        failure = DataclassFailure{collection.dataclass, failureSentence(collection.dataclass, e),
                                   failureKind(e)};
        VTC_LOG_ERROR("Sync of %@ failed: %@", collection.dataclass, e);
      } catch (const std::bad_alloc&) {
        failure = DataclassFailure{collection.dataclass,
                                   "Syncing " + collection.dataclass +
                                       " needed more memory than this computer could give; the "
                                       "other folders were synced, and the next sync tries "
                                       "again.",
                                   FailureKind::Other};
        VTC_LOG_ERROR("Sync of %@ ran out of memory", collection.dataclass);
      } catch (const std::exception& e) {
        failure = DataclassFailure{collection.dataclass,
                                   "Syncing " + collection.dataclass + " failed: " + e.what(),
                                   FailureKind::Other};
        VTC_LOG_ERROR("Sync of %@ failed: %@", collection.dataclass, e.what());
      }
      if (failure) outcome = sync.outcome();
      usedServer = usedServer || outcome.usedServer;
      if (!request.dryRun && !failure) {
        const auto listed = view.record(collection.dataclass);
        syncCollectionMeta(*session, collection,
                           listed ? CollectionMeta{listed->collectionName, listed->collectionColor}
                                  : CollectionMeta{});
      }
      if (!request.dryRun) {
        prefs.setSyncSuccessful(!failure, collection.dataclass);
        rememberOutcome(outcome, failure ? &failure->sentence : nullptr);
      }
      summary.set(collection.dataclass,
                  Value(summaryEntry(outcome, start, currentClock().now(),
                                     failure ? &failure->sentence : nullptr)));
      renewal.done(collection.dataclass);
      result.outcomes.push_back(outcome);
      if (failure) {
        result.failures.push_back(*failure);
        // Without the server there is nothing more to do this run.
        if (failure->kind == FailureKind::Unreachable) break;
      }
    }
  } catch (const NubiloException& e) {
    engine->endSyncPlan(plan);
    throw SyncFailure(failureKind(e), failureSentence("the account", e));
  }
  engine->endSyncPlan(plan);
  locks.clear();

  if (!request.dryRun && usedServer) {
    summary.set("GlobalSyncDuration",
                Value(std::chrono::duration<double>(currentClock().now() - runStart).count()));
    Dictionary statistics;
    for (const DataclassOutcome& o : result.outcomes) {
      statistics.set("LastSentChanges." + o.dataclass, Value(static_cast<int64_t>(o.sentChanges)));
      statistics.set("LastReceivedChanges." + o.dataclass,
                     Value(static_cast<int64_t>(o.receivedChanges)));
    }
    VTCLogStatistics(statistics);
    try {
      session->sendReportingInfo(summary);
    } catch (const NubiloException& e) {
      // The changes are committed; a report that did not go out is no failure.
      VTC_LOG_WARNING("The sync report could not be written: %@", e.reason());
    }
  }
  if (!request.dryRun && result.failures.empty()) {
    // For the other computers' status: when this one last synced (an idle
    // sync too), and which report is its own. Not judged: it only informs.
    // An encrypted account's share sees the name and the conflicts sealed.
    std::string name = options.computerName;
    std::string shared = sharedConflictsText(conflicts.list());
    if (const sealing::AccountSeal* seal = session->accountSeal()) {
      name = seal->sealText(name, sealing::kClientNamePurpose);
      shared = seal->sealText(shared, sealing::kSharedConflictsPurpose);
    }
    Dictionary record{{"lastsync", textOf(Value(currentClock().now()))},
                      {"clientname", Value(name)},
                      {kSharedConflictsKey, Value(shared)}};
    if (auto machine = getHostUUIDString()) record.set("machineguid", Value(*machine));
    try {
      session->patchClientInfo(record);
    } catch (const NubiloException& e) {
      VTC_LOG_WARNING("This computer's last sync could not be noted on the share: %@", e.reason());
    }
  }
  if (!request.dryRun && result.failures.empty())
    prefs.setLastSuccessfulSyncDate(currentClock().now());
  if (!request.dryRun) {
    // The other computers learn of each new changelog at once.
    std::vector<std::string> committed;
    for (const DataclassOutcome& o : result.outcomes)
      if (o.committedIndex) committed.push_back(o.dataclass);
    if (auto broker = push::configuredBroker(); broker && !broker->tls && !committed.empty())
      if (auto warning =
              network::passwordInClearWarning(member, broker->host, broker->url(), "MQTT"))
        result.warnings.push_back(*warning);
    announceCommits(member, password, committed);
  }
  return result;
}

}  // namespace vtc::client
