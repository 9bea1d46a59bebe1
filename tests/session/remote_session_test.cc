// NubiloRemoteSession against a real share behind a fault-injecting proxy:
// requests with retry, locking between clients, the dataclass and client
// registries as whole scenarios (the server's state checked through a second
// session), and what the session does when the server or network misbehaves.
#include <gmock/gmock.h>

#include <algorithm>
#include <filesystem>
#include <optional>
#include <set>

#include "VantorSyncManager/AssertionHandler.h"
#include "VantorSyncManager/NubiloException.h"
#include "VantorSyncManager/PublicNames.h"
#include "VantorSyncManager/VTCPrefsCenter.h"
#include "common/Format.h"
#include "platform/dav/LockRecord.h"
#include "platform/dav/TesselSession.h"
#include "support/Failures.h"
#include "support/FaultProxy.h"
#include "support/ShareTest.h"

using testing::StartsWith;
using testing::ThrowsMessage;
using vtc::test::ThrowsFailure;
using vtc::test::TraceCapture;

namespace {

constexpr const char* kRetry = "com.korvo.sync.nubilosession.retrytransaction";
constexpr const char* kCode = "com.korvo.sync.nubilosession.retrytransaction.errorcode";
constexpr const char* kFinal = "com.korvo.sync.nubilosession.retrytransaction.final";

class ShareBehindProxy : public vtc::test::ShareTest {
 protected:
  explicit ShareBehindProxy(vtc::test::ShareKind kind = vtc::test::ShareKind::Apache)
      : ShareTest(kind) {}

  vtc::test::FaultProxy proxy{share.port()};
  std::unique_ptr<NubiloRemoteSession> session = open("GUID-A", "Alice's Mac");
  const std::string schemas = session->schemasPath();

  // A client's session, through the proxy.
  std::unique_ptr<NubiloRemoteSession> open(const std::string& guid, const std::string& name,
                                            int attempts = 3, const vtc::Dictionary& more = {}) {
    vtc::Dictionary overrides = clientOverrides(guid);
    overrides.merge({{"host_port", proxy.port()},
                     {"ClientName", name},
                     {"max_lock_acquire_attempts", attempts}});
    overrides.merge(more);
    return openSession(overrides);
  }
  // The messages logged at this level that start with prefix.
  std::vector<std::string> logs(const std::string& level, const std::string& prefix) const {
    std::vector<std::string> out = logged.messages(level);
    std::erase_if(out, [&](const std::string& m) { return !m.starts_with(prefix); });
    return out;
  }

  // How many requests of this method on this path the proxy saw.
  size_t seen(const std::string& method, const std::string& path) const {
    auto all = proxy.requests();
    return std::count_if(all.begin(), all.end(),
                         [&](const auto& s) { return s.method == method && s.path == path; });
  }
  // A field of the nth trace record of a domain.
  std::string field(const char* domain, size_t n, const std::string& key) const {
    return TraceCapture::field(traces.withDomain(domain).at(n), key);
  }
  // The sync-namespace record of a dataclass collection, as session s sees it.
  vtc::Dictionary recordAt(NubiloRemoteSession& s, const std::string& path) {
    DavTransaction t =
        s.tesselSession()._issuePropFindAtPath(path, 0, s.dataclassRecordProperties());
    vtc::Dictionary record;
    if (!t.isSuccessful()) return record;
    const std::string& ns = s.syncNamespace();
    for (const auto& [name, value] : t.result().dictionary().begin()->second.dictionary())
      if (name.starts_with(ns)) record.set(name.substr(ns.size()), value);
    return record;
  }
};
using Retry = ShareBehindProxy;
using Locking = vtc::test::OnEachServer<ShareBehindProxy>;
using Registry = vtc::test::OnEachServer<ShareBehindProxy>;
using RegistryEdges = ShareBehindProxy;
INSTANTIATE_TEST_SUITE_P(Servers, Locking, vtc::test::kEachServer, vtc::test::serverName);
INSTANTIATE_TEST_SUITE_P(Servers, Registry, vtc::test::kEachServer, vtc::test::serverName);

TEST_F(Retry, ATimeOutIsTriedOnceMoreAndTheSecondAnswerReturnedEvenANetworkFailure) {
  // Waits a second for an answer, neon's smallest time-out.
  auto quick = openSession({{"host_port", proxy.port()}, {"sync_dav_timeout_seconds", 1}});
  std::string path = schemas + "/x.clog";
  proxy.timeOut({"PUT", path, 1});
  proxy.dropConnection({"PUT", path, 0});
  EXPECT_EQ(quick->putDataWithRetry({'x'}, path).errorType(), kNBNetworkError);
  EXPECT_EQ(seen("PUT", path), 2u);
  EXPECT_EQ(logged.count("Warning", "putData transaction failed due to timeout, retrying..."), 1u);
  EXPECT_THAT(logs("Info", "Transaction: "),
              testing::ElementsAre(StartsWith("Transaction: <DavTransaction PUT " + path)));
  EXPECT_TRUE(time.sleeps().empty());
  // A retry report of two records tied together and to the session; no final one.
  quick->messageTraceTransactionFailure(DavTransaction(), true, 0, "no request, no records");
  ASSERT_EQ(traces.records().size(), 2u);
  EXPECT_EQ(field(kRetry, 0, "COM_KORVO_MESSAGE_SIGNATURE"), "PUT");
  EXPECT_EQ(field(kRetry, 0, "COM_KORVO_MESSAGE_VALUE"), "0");
  EXPECT_EQ(field(kRetry, 0, "COM_KORVO_MESSAGE_RESULT"), "noop");
  EXPECT_EQ(field(kRetry, 0, "COM_KORVO_MESSAGE_EVENT"), quick->eventUUID());
  EXPECT_EQ(field(kCode, 0, "COM_KORVO_MESSAGE_SIGNATURE"), "kNBTimeoutError");
  EXPECT_EQ(field(kCode, 0, "COM_KORVO_MESSAGE_SIGNATURE2"), "");  // no status
  EXPECT_EQ(field(kRetry, 0, "COM_KORVO_MESSAGE_UUID"), field(kCode, 0, "COM_KORVO_MESSAGE_UUID"));
}

TEST_F(Retry, OnlyAMissingDownloadWaitsAndIsTriedAgainOtherFailuresAreReturnedAtOnce) {
  std::string full = schemas + "/full.clog";
  proxy.answer({"PUT", full, 0}, 507);
  DavTransaction t = session->putDataWithRetry({'x'}, full);
  EXPECT_EQ(t.errorType(), kNBInsufficientStorage);
  EXPECT_EQ(t.httpStatusCode(), 507);
  EXPECT_EQ(seen("PUT", full), 1u);
  std::string missing = schemas + "/missing/";
  t = session->_issuePropFindWithRetryAtPath(missing, kDAVZeroDepth, {});
  EXPECT_EQ(t.httpStatusCode(), 404);
  EXPECT_EQ(seen("PROPFIND", missing), 1u);
  std::string a = schemas + "/a.clog";
  std::string b = schemas + "/b.clog";
  session->putDataWithRetry({'1'}, a);
  session->putDataWithRetry({'2'}, b);
  t = session->moveResourceWithRetryAtPath(a, b, /*allowingOverwrite=*/false);
  EXPECT_FALSE(t.isSuccessful());
  EXPECT_EQ(t.httpStatusCode(), 412);
  EXPECT_EQ(logged.messages("Warning"),
            std::vector<std::string>{
                "moveResorce transaction failed, resource already exists at destination " + b});
  EXPECT_TRUE(session->moveResourceWithRetryAtPath(a, b).isSuccessful());
  EXPECT_TRUE(traces.records().empty());
  EXPECT_TRUE(time.sleeps().empty());

  EXPECT_EQ(session->getDataWithRetryAtPath(schemas + "/00001.clog").httpStatusCode(), 404);
  EXPECT_EQ(time.sleeps(), std::vector<double>{30});
  EXPECT_EQ(
      logged.count("Warning", "getData transaction failed due to 404 file not found at path " +
                                  schemas + "/00001.clog, retrying..."),
      1u);
  ASSERT_EQ(traces.withDomain(kRetry).size(), 2u);
  EXPECT_EQ(field(kRetry, 1, "COM_KORVO_MESSAGE_VALUE"), "1");
  ASSERT_EQ(traces.withDomain(kFinal).size(), 1u);
  EXPECT_EQ(field(kFinal, 0, "MESSAGE"), "Failed to get data");
  session->getDataWithRetryAtPath(schemas + "/00002.clog", std::nullopt, 0, 0, std::nullopt);
  EXPECT_EQ(time.sleeps(), (std::vector<double>{30, 2}));
}

TEST_F(Retry, AServerThatWentAwayRaisesANetworkFailure) {
  auto direct = openSession();  // the proxy would still be listening
  share.stop();
  EXPECT_THAT([&] { direct->putDataWithRetry({'x'}, schemas + "/00001.clog"); },
              ThrowsMessage<NubiloException>(StartsWith(
                  "NubiloNetworkFailureException: putData transaction failed due to network "
                  "error, <")));
  ASSERT_EQ(traces.withDomain(kFinal).size(), 1u);
  EXPECT_EQ(field(kFinal, 0, "COM_KORVO_MESSAGE_SIGNATURE"), "Raised Exception");
  EXPECT_EQ(field(kFinal, 0, "COM_KORVO_MESSAGE_RESULT"), "failure");
  EXPECT_EQ(field(kFinal, 0, "COM_KORVO_MESSAGE_UUID"), field(kRetry, 0, "COM_KORVO_MESSAGE_UUID"));
  EXPECT_EQ(field(kCode, 0, "COM_KORVO_MESSAGE_SIGNATURE"), "kNBNetworkError");
  EXPECT_TRUE(time.sleeps().empty());
  EXPECT_EQ(logged.messages("Warning"),
            std::vector<std::string>{"putData transaction failed due to network error raising..."});
}

TEST_P(Locking, AContenderWaitsOutItsAttemptsAndLearnsWhoHoldsTheLock) {
  auto b = open("GUID-B", "Bob's Mac");
  session->tesselSession().makeCollectionAtPath(schemas + "/Contacts", false);
  session->lockDataclass("Contacts");
  size_t locks = proxy.count("LOCK");
  try {
    b->lockDataclass("Contacts");
    FAIL() << "no exception";
  } catch (const NubiloException& e) {
    EXPECT_EQ(e.name(), NubiloLockFailureException);
    EXPECT_EQ(e.reason(), "Failed to lock resource, " + schemas + "/Contacts/");
    const vtc::Array& holders = e.userInfo().get("DAV:lockdiscovery").array();
    ASSERT_EQ(holders.size(), 1u) << e.userInfo().description();
    EXPECT_EQ(holders[0].dictionary().get("clientid").string(), "GUID-A");
    EXPECT_EQ(holders[0].dictionary().get("clientname").string(), "Alice's Mac");
  }
  EXPECT_EQ(proxy.count("LOCK") - locks, 4u);  // max attempts + 1
  // Pauses that never shrink.
  std::vector<double> pauses = time.sleeps();
  ASSERT_EQ(pauses.size(), 3u);
  EXPECT_TRUE(std::is_sorted(pauses.begin(), pauses.end()));
  ASSERT_EQ(traces.withDomain(kRetry).size(), 3u);
  for (size_t i = 0; i < 3; ++i)
    EXPECT_EQ(field(kRetry, i, "COM_KORVO_MESSAGE_VALUE"), std::to_string(i));
  EXPECT_TRUE(traces.withDomain(kFinal).empty());
  EXPECT_TRUE(b->lockedResources().empty());
  const std::string target = schemas + "/Contacts/";
  auto attempts = logs("Warning", "Lock attempt ");
  ASSERT_EQ(attempts.size(), 3u);
  for (size_t i = 0; i < 3; ++i)
    EXPECT_EQ(attempts[i], vtc::format("Lock attempt %d of %@ failed, retrying in %d seconds",
                                       int(i + 1), target, int(pauses[i])));
  EXPECT_EQ(logs("Warning", "Failed to lock "),
            std::vector<std::string>{"Failed to lock " + target +
                                     " after 3 lock attempts, raising exception"});

  // A long configured pause is held to the 90-second ceiling.
  auto c = open("GUID-C", "Carol's Mac", 3, {{"lock_acquire_sleep_seconds", 1000000000}});
  EXPECT_THAT([&] { c->lockDataclass("Contacts"); }, ThrowsFailure(NubiloLockFailureException));
  pauses = time.sleeps();
  ASSERT_EQ(pauses.size(), 6u);
  EXPECT_TRUE(std::all_of(pauses.begin() + 3, pauses.end(), [](double p) { return p <= 90.0; }));
  EXPECT_EQ(pauses.back(), 90.0);
  EXPECT_EQ(logs("Warning", "Lock attempt 3 of ").back(),
            "Lock attempt 3 of " + target + " failed, retrying in 90 seconds");

  // Once the holder lets go, the contender gets the lock at once.
  session->unlockDataclass("Contacts");
  EXPECT_TRUE(session->lockedResources().empty());
  b->lockDataclass("Contacts");
  EXPECT_EQ(time.sleeps().size(), 6u);
  EXPECT_EQ(b->lockedResources(), std::set<std::string>{target});
  EXPECT_EQ(logged.count("Info", "Locking dataclass Contacts"), 2u);
  EXPECT_EQ(logged.count("Info", "Unlocking dataclass Contacts"), 1u);
}

TEST_P(Locking, WithNoRetriesOneRefusalFailsAtOnceAndAReleasedSessionUnlocksWhatItHeld) {
  auto b = open("GUID-B", "Bob's Mac", /*attempts=*/0);
  session->tesselSession().putData({}, session->clientsPath() + "/GUID-A.client");
  session->lockClient();
  session->lockDataclasses();
  EXPECT_EQ(session->lockedResources(),
            (std::set<std::string>{session->clientsPath() + "/GUID-A.client", schemas + "/"}));
  size_t locks = proxy.count("LOCK");
  EXPECT_THAT([&] { b->lockClient("GUID-A"); }, ThrowsFailure(NubiloLockFailureException));
  EXPECT_EQ(proxy.count("LOCK") - locks, 1u);
  EXPECT_TRUE(time.sleeps().empty());
  EXPECT_TRUE(traces.records().empty());
  const std::string client = session->clientsPath() + "/GUID-A.client";
  EXPECT_EQ(logs("Warning", "Failed to lock "),
            std::vector<std::string>{"Failed to lock " + client +
                                     " after 0 lock attempts, raising exception"});
  session.reset();
  EXPECT_EQ(
      logs("Warning", "Resource "),
      (std::vector<std::string>{
          "Resource " + client + " appears to still be locked when ending session, unlocking...",
          "Resource " + schemas +
              "/ appears to still be locked when ending session, unlocking..."}));
  b->lockClient("GUID-A");
  b->lockDataclasses();
  EXPECT_EQ(b->lockedResources().size(), 2u);
}

TEST_P(Locking, LocksOnMissingOrForgottenResourcesFail) {
  EXPECT_THAT([&] { session->lockClient("NOBODY"); },
              ThrowsMessage<NubiloException>("NubiloClientRegistrationException: Attempting to "
                                             "lock a client that doesn't exist, NOBODY"));
  EXPECT_THAT([&] { session->lockDataclass("Unregistered"); },
              ThrowsMessage<NubiloException>(StartsWith("NubiloResourceNotFoundException: ")));
  // Nothing is left where the locks were asked for, whether or not the
  // server honoured If-Match.
  EXPECT_FALSE(share.members(session->clientsPath()).count("NOBODY.client"));
  EXPECT_FALSE(share.members(schemas).count("Unregistered"));
  EXPECT_TRUE(time.sleeps().empty());
  EXPECT_EQ(traces.withDomain(kFinal).size(), 2u);
  EXPECT_EQ(logs("Warning", "Lock transaction failed due to resource not found at "),
            (std::vector<std::string>{"Lock transaction failed due to resource not found at " +
                                          session->clientsPath() + "/NOBODY.client",
                                      "Lock transaction failed due to resource not found at " +
                                          schemas + "/Unregistered/"}));
  session->unlockClient("NOBODY");  // logged, never raised

  // A lock the server forgot, as one that timed out, can be neither renewed
  // nor released.
  session->tesselSession().makeCollectionAtPath(schemas + "/Contacts", false);
  session->lockDataclass("Contacts");
  session->relockDataclass("Contacts");
  share.forgetLocks();
  EXPECT_THAT(
      [&] { session->relockDataclass("Contacts"); },
      ThrowsMessage<NubiloException>("NubiloRelockFailureException: Failed to relock resource, " +
                                     schemas + "/Contacts/"));
  ASSERT_EQ(traces.withDomain(kFinal).size(), 3u);
  EXPECT_EQ(field(kFinal, 2, "MESSAGE"), "Failed to relock resource");
  session->unlockDataclass("Contacts");
  EXPECT_EQ(session->lockedResources().size(), 1u);  // kept for the release to try again
  const std::string contacts = schemas + "/Contacts/";
  EXPECT_EQ(logged.count("Warning", "Failed to unlock resource " + contacts + ", retrying..."), 1u);
  EXPECT_EQ(logged.messages("Error").back(),
            "Failed to unlock resource (lock not held), " + contacts);
}

TEST_P(Locking, ALockCutOffIsRaisedAfterOnePause) {
  const std::string target = schemas + "/Contacts/";
  session->tesselSession().makeCollectionAtPath(schemas + "/Contacts", false);
  proxy.answer({"LOCK", target, 1}, 423);
  proxy.dropConnection({"LOCK", target, 0});
  EXPECT_THAT(
      [&] { session->lockDataclass("Contacts"); },
      ThrowsMessage<NubiloException>(StartsWith(
          "NubiloNetworkFailureException: Lock transaction failed due to network error, ")));
  EXPECT_EQ(time.sleeps().size(), 1u);
  ASSERT_EQ(traces.withDomain(kFinal).size(), 1u);
  EXPECT_EQ(field(kRetry, 1, "COM_KORVO_MESSAGE_VALUE"), "1");
}

TEST_P(Locking, ALockThatExpiredIsTakenAgainAndOnlyAMissingTargetIsNotFound) {
  const std::string client = session->clientsPath() + "/GUID-A.client";
  session->tesselSession().putData({}, client);
  session->lockClient();
  share.forgetLocks();  // expired on the server; the session still holds its token
  session->lockClient();
  EXPECT_EQ(session->lockedResources(), std::set<std::string>{client});
  auto b = open("GUID-B", "Bob's Mac", /*attempts=*/0);
  EXPECT_THAT([&] { b->lockClient("GUID-A"); }, ThrowsFailure(NubiloLockFailureException));

  // Gone while locked: the stale token set aside, the target is missing.
  session->tesselSession().deleteResourceAtPath(client);
  EXPECT_THAT([&] { session->lockClient(); }, ThrowsFailure(NubiloClientRegistrationException));
  // A missing parent is as missing as the target, with no waiting.
  std::filesystem::remove_all(share.diskPath(schemas));
  EXPECT_THAT([&] { session->lockDataclass("Inner"); },
              ThrowsFailure(NubiloResourceNotFoundException));
  EXPECT_TRUE(time.sleeps().empty());
}

TEST_P(Locking, ALockWhoseRenewalOrReleaseWasRefusedIsStillReleasedOnTheServer) {
  const std::string target = schemas + "/Contacts/";
  session->tesselSession().makeCollectionAtPath(schemas + "/Contacts", false);
  session->lockDataclass("Contacts");
  proxy.answer({"LOCK", target, 0}, 423);
  EXPECT_THAT([&] { session->relockDataclass("Contacts"); },
              ThrowsFailure(NubiloRelockFailureException));
  proxy.clear();
  session->unlockDataclass("Contacts");
  EXPECT_EQ(seen("UNLOCK", target), 1u);
  EXPECT_TRUE(session->lockedResources().empty());

  // An unlock is tried twice at once; a failed one is kept for the release.
  session->lockDataclass("Contacts");
  proxy.answer({"UNLOCK", target, 0}, 403);
  session->unlockDataclass("Contacts");
  EXPECT_EQ(seen("UNLOCK", target), 3u);  // both tries sent
  EXPECT_EQ(session->lockedResources().count(target), 1u);
  EXPECT_TRUE(time.sleeps().empty());
  proxy.clear();
  session.reset();  // the release sends it once more, and the server lets go
  EXPECT_EQ(seen("UNLOCK", target), 4u);
  auto b = open("GUID-B", "Bob's Mac", /*attempts=*/0);
  b->lockDataclass("Contacts");
  EXPECT_EQ(b->lockedResources(), std::set<std::string>{target});
}

// A lock outlives its holder, as one of a process killed mid-sync does.
// Apache ends it when the time-out that the holder asked for runs out;
// SabreDAV keeps every lock for its own half hour, so the holder's lock
// record says when it was due, and the next contender gives it back. A lock
// that is not due yet stays.
TEST_P(Locking, ALockPastTheTimeOutItsHolderAskedForIsGivenBackByTheNextContender) {
  auto b = open("GUID-B", "Bob's Mac", /*attempts=*/0);
  b->tesselSession().putData({}, b->clientsPath() + "/GUID-B.client");
  b->lockClient();  // what B learns of the server's locks, it learns from its own
  const std::string target = schemas + "/Contacts/";
  session->tesselSession().makeCollectionAtPath(schemas + "/Contacts", false);
  session->lockDataclass("Contacts");
  EXPECT_THAT([&] { b->lockDataclass("Contacts"); }, ThrowsFailure(NubiloLockFailureException));

  TesselSession& holder = session->tesselSession();
  if (onApache()) {
    share.forgetLocks();
  } else {
    DavTransaction attributes = holder.extendedAttributesAtPath(target);
    const vtc::Value& text = attributes.result().dictionary().get(vtc::kLockRecordProperty);
    std::optional<vtc::LockRecord> record = vtc::LockRecord::parse(text.string());
    ASSERT_TRUE(record) << text.description();
    EXPECT_EQ(record->token, holder.lockTokenForPath(target));
    EXPECT_THAT(record->owner, testing::HasSubstr("<SY:clientid>GUID-A</SY:clientid>"));
    record->expires = 1;  // long past, in any server's time
    ASSERT_TRUE(holder
                    ._issuePropPatchAtPath(target, {{vtc::kLockRecordName, record->text()}},
                                           vtc::kLockRecordNamespace)
                    .isSuccessful());
  }
  b->lockDataclass("Contacts");
  EXPECT_TRUE(b->lockedResources().count(target));
  EXPECT_TRUE(time.sleeps().empty());
  EXPECT_THAT([&] { session->relockDataclass("Contacts"); },
              ThrowsFailure(NubiloRelockFailureException));
  // The record goes with the unlock: none is left to name a lock that ended.
  b->unlockDataclass("Contacts");
  EXPECT_FALSE(b->tesselSession().extendedAttributesAtPath(target).result().dictionary().contains(
      vtc::kLockRecordProperty));
}

TEST_P(Registry, ADataclassFromUnregisteredToPopulatedToResetToGone) {
  const std::string dc = "com.korvo.Contacts";
  NubiloRemoteSession& a = *session;
  auto observer = open("GUID-OBSERVER", "Observer");
  std::string collection = schemas + "/" + dc + "/";

  EXPECT_TRUE(recordAt(*observer, collection).empty());
  EXPECT_THAT(a.getDataclassInfo(dc).keys(),  // registers it
              testing::UnorderedElementsAre("DAV:getetag", "dataclassname", "displayname"));
  EXPECT_EQ(recordAt(*observer, collection).get("dataclassname").string(), dc);
  EXPECT_EQ(logged.count("Info", "Creating dataclass directory for " + dc), 1u);
  EXPECT_EQ(a.dataclassNames(), std::vector<std::string>{dc});
  EXPECT_TRUE(a.validPropertiesForDataclass(dc));

  a.lockDataclass(dc);
  for (uint8_t i = 1; i <= 3; ++i)
    ASSERT_TRUE(
        a.tesselSession().putData({'c', i}, a.changeLogPathForDataclass(dc, i)).isSuccessful());
  a.tesselSession().putData({'x'}, collection + "00004.clog.tmp");
  a.setInfoForDataclass(vtc::Dictionary{{"minversion", "00001"}, {"maxversion", "00003"}}, dc);
  EXPECT_EQ(a.changeLogVersionsForDataclass(dc),
            (std::vector<std::string>{"00001", "00002", "00003"}));
  EXPECT_TRUE(a.validPropertiesForDataclass(dc));
  EXPECT_EQ(a.calculateStorageConsumedForDataclass(dc), 7);
  EXPECT_EQ(recordAt(*observer, collection).get("maxversion").string(), "00003");

  // An incoherent record is found and repaired from the files present.
  a.setInfoForDataclass(vtc::Dictionary{{"maxversion", "00005"}}, dc);
  EXPECT_FALSE(a.validPropertiesForDataclass(dc));
  a.setInfoForDataclass(a.calculatePropertiesForDataclass(dc), dc);
  EXPECT_TRUE(a.validPropertiesForDataclass(dc));

  // Fast reset: the collection goes to the trash in one move, and every
  // client but the resetter is told it needs the truth.
  for (const char* guid : {"GUID-A", "GUID-B", "GUID-C"}) a.registerClient(guid, guid);
  a.setInfoForClient(vtc::Dictionary{{dc + ".version", "7"}, {dc + ".status", "normal"}}, "GUID-B");
  a.resetDataclass(dc);
  vtc::Dictionary afterReset = recordAt(*observer, collection);
  EXPECT_FALSE(afterReset.contains("minversion"));
  EXPECT_FALSE(afterReset.contains("maxversion"));
  EXPECT_FALSE(afterReset.contains("status"));
  EXPECT_TRUE(a.changeLogVersionsForDataclass(dc).empty());
  EXPECT_EQ(proxy.count("MOVE"), 1u);
  EXPECT_EQ(share.members("/Web/.Temporary Web Resources/SyncWorks/Trash").size(), 1u);
  EXPECT_TRUE(a.lockedResources().count(collection));
  EXPECT_EQ(a.getClientInfo("GUID-B").get(dc + ".status").string(), "needstruth");
  EXPECT_FALSE(a.getClientInfo("GUID-B").contains(dc + ".version"));
  EXPECT_EQ(a.getClientInfo("GUID-C").get(dc + ".status").string(), "needstruth");
  EXPECT_FALSE(a.getClientInfo("GUID-A").contains(dc + ".status"));
  // Statuses already in place cost only the relock, the listing and the
  // reads (and the renewed lock record where the server keeps a lock longer
  // than asked).
  a.lockClients();
  size_t sent = proxy.requests().size();
  size_t patches = proxy.count("PROPPATCH");
  a.setOtherClientStatus("needstruth", dc);
  const size_t record = onApache() ? 0 : 1;
  EXPECT_EQ(proxy.count("PROPPATCH"), patches + record);
  EXPECT_EQ(proxy.requests().size() - sent, 4u + record);
  a.unlockClients();

  // Unregistered, the dataclass leaves the listing; another one stays.
  a.getDataclassInfo("com.korvo.Calendars");
  EXPECT_EQ(a.getAllDataclassInfo().size(), 2u);
  a.unlockDataclass(dc);
  EXPECT_TRUE(a.unregisterDataclass(dc));
  EXPECT_TRUE(recordAt(*observer, collection).empty());
  vtc::Array left = a.getAllDataclassInfo();
  ASSERT_EQ(left.size(), 1u);
  EXPECT_EQ(left[0].dictionary().get("dataclassname").string(), "com.korvo.Calendars");
  EXPECT_EQ(left[0].dictionary().get("displayname").string(), "com.korvo.Calendars");
  EXPECT_TRUE(a.lockedResources().empty());
}

TEST_P(Registry, ClientsRegisterAndABrokenRecordIsCleanedUp) {
  auto& a = session;
  auto b = open("GUID-B", "Bob's Mac");
  auto c = open("GUID C", "Carol's Mac");
  EXPECT_TRUE(a->registerClient("GUID-A", "Alice's \x07Mac"));
  EXPECT_TRUE(b->registerClient("GUID-B", "Bob's Mac"));
  EXPECT_TRUE(c->registerClient("GUID C", "Carol's Mac"));
  EXPECT_THAT([&] { a->registerClient("GUID-A", "again"); },
              ThrowsFailure(NubiloClientRegistrationException));
  EXPECT_EQ(logged.count("Warning",
                         "Attempt to register client that is already registered GUID:GUID-A "
                         "Name:again"),
            1u);

  vtc::Dictionary record = b->getClientInfo("GUID-A");
  EXPECT_EQ(record.get("clientname").string(), "Alice's Mac");
  EXPECT_EQ(record.get("classname").string(), "bramble");
  EXPECT_EQ(record.get("buildversion").string(), "VantorSyncClient-488.5");
  EXPECT_EQ(VTCPrefsCenter::defaultCenter().clientGuid(), "GUID C");  // the last to register here

  // Carol's record loses its name: listed once more, then removed, though
  // the server escapes her guid in its href.
  // A resource registered without a guid is removed unlisted.
  c->setInfoForClient(vtc::Dictionary{{"clientname", kNBRemoveProp}}, "GUID C");
  a->tesselSession().putData({}, a->clientsPath() + "/.client");
  EXPECT_EQ(a->getAllClientInfo().size(), 3u);
  EXPECT_FALSE(std::filesystem::exists(share.diskPath(a->clientsPath() + "/GUID C.client")));
  EXPECT_FALSE(std::filesystem::exists(share.diskPath(a->clientsPath() + "/.client")));
  EXPECT_THAT(logged.messages("Error"),
              testing::UnorderedElementsAre(
                  "Invalid client found removing...",
                  "Missing guid or name found on client /Library/Application%20Support/SyncWorks/"
                  "Clients/GUID%20C.client removing..."));
  EXPECT_EQ(logged.count("Info", "Unregistering client GUID C"), 1u);
  EXPECT_EQ(a->getAllClientInfo().size(), 2u);
  EXPECT_THAT([&] { a->getClientInfo("GUID C"); },
              ThrowsFailure(NubiloClientRegistrationException));
  EXPECT_EQ(logged.messages("Error").back(), "Failed to obtain client info for GUID C");
  EXPECT_TRUE(b->unregisterClient("GUID-B"));
  EXPECT_EQ(a->getAllClientInfo().size(), 1u);

  // A record is looked up under the href asked for: Apache spells this one's
  // "&" unescaped, and the record comes back empty, not as a failure;
  // SabreDAV escapes it as the request did.
  EXPECT_TRUE(a->registerClient("G&1", "Gee"));
  EXPECT_EQ(a->getClientInfo("G&1").empty(), onApache());
  EXPECT_EQ(a->getAllClientInfo().size(), 2u);
}

TEST_P(Registry, ARefusedMoveMakesTheResetDeleteChangelogByChangelogRenewingItsLocks) {
  std::string dc = "Contacts";
  session->getDataclassInfo(dc);
  session->lockDataclass(dc);
  for (int i = 3; i <= 8; ++i)
    session->tesselSession().putData({'c'}, session->changeLogPathForDataclass(dc, i));
  session->setInfoForDataclass(vtc::Dictionary{{"minversion", "00003"}, {"maxversion", "00008"}},
                               dc);
  proxy.answer({"MOVE", schemas + "/" + dc, 0}, 500);
  size_t locksBefore = proxy.count("LOCK");
  time.advanceOnEveryReading(vtc::Seconds(50));  // each step takes long: renewals are due
  session->resetDataclass(dc);
  time.advanceOnEveryReading(vtc::Seconds(0));

  EXPECT_TRUE(session->changeLogVersionsForDataclass(dc).empty());
  for (int i = 3; i <= 8; ++i)
    EXPECT_EQ(seen("DELETE", session->changeLogPathForDataclass(dc, i)), 1u) << i;
  vtc::Dictionary record = session->getDataclassInfo(dc);
  EXPECT_FALSE(record.contains("minversion"));
  EXPECT_FALSE(record.contains("maxversion"));
  // Renewals of the dataclass and clients locks beside the fresh locks taken.
  EXPECT_GT(proxy.count("LOCK") - locksBefore, 4u);
  EXPECT_TRUE(session->lockedResources().count(schemas + "/" + dc + "/"));
  ASSERT_EQ(traces.withDomain(kRetry).size(), 1u);
  EXPECT_EQ(field(kRetry, 0, "MESSAGE"), "Failed to move dataclass aside for reset");
  EXPECT_EQ(field(kCode, 0, "COM_KORVO_MESSAGE_SIGNATURE2"), "500");
  EXPECT_EQ(logged.count("Warning",
                         "Failed to move Contacts dataclass collection aside for reset "
                         "(probably too many clogs), reverting to removing clogs "
                         "individually"),
            1u);
  std::vector<std::string> removals = logs("Info", "Removing changelog ");
  ASSERT_EQ(removals.size(), 6u);
  EXPECT_EQ(removals.front(), "Removing changelog 3 for dataclass Contacts");
  EXPECT_EQ(removals.back(), "Removing changelog 8 for dataclass Contacts");
}

TEST_F(RegistryEdges,
       RegistrationWaitsOutAuthorizationFailuresAndRecordReadsNameTheAccountsTrouble) {
  std::string client = session->clientsPath() + "/GUID-B.client";
  proxy.answer({"PROPFIND", client, 0}, 401);
  EXPECT_TRUE(session->registerClient("GUID-B", "Bob"));
  EXPECT_EQ(time.sleeps(), (std::vector<double>{30, 30, 30}));
  EXPECT_EQ(logged.count("Warning", "Authorization failure accessing " + client +
                                        ", trying again in 30 seconds"),
            3u);
  ASSERT_EQ(traces.withDomain(kFinal).size(), 1u);
  EXPECT_EQ(field(kFinal, 0, "MESSAGE"), "Failed to get basic attributes on Client");
  proxy.clear();
  EXPECT_EQ(session->getClientInfo("GUID-B").get("clientname").string(), "Bob");

  for (auto [status, name] : {std::pair{402, "NubiloAccountExpiredException: "},
                              {508, "NubiloAccountMigratedException: "},
                              {500, "NubiloTransactionFailureException: "}}) {
    proxy.clear();
    proxy.answer({"PROPFIND", client, 0}, status);
    EXPECT_THAT([&] { session->getClientInfo("GUID-B"); },
                ThrowsMessage<NubiloException>(StartsWith(name)))
        << status;
  }
  proxy.clear();
  proxy.answer({"PROPFIND", schemas + "/Contacts/", 0}, 402);
  EXPECT_THAT([&] { session->getDataclassInfo("Contacts"); },
              ThrowsMessage<NubiloException>(StartsWith("NubiloAccountExpiredException: ")));
  proxy.answer({"DELETE", client, 0}, 500);
  EXPECT_FALSE(session->unregisterClient("GUID-B"));
}

TEST_F(RegistryEdges, AClientWithoutGuidOrNameIsAnAssertionFailureBeforeAnyRequest) {
  size_t sent = proxy.requests().size();
  try {
    session->registerClient("", "Nameless");
    FAIL() << "no assertion";
  } catch (const vtc::AssertionFailure& e) {
    EXPECT_EQ(e.description(), "registerClient: client guid is missing!");
    EXPECT_EQ(e.className(), "NubiloRemoteSession");
    EXPECT_EQ(e.file(), "ClientRegistry.cc");
    EXPECT_THAT(logged.messages("Error"),
                testing::ElementsAre("Assertion failure in NubiloRemoteSession::registerClient, "
                                     "ClientRegistry.cc:" +
                                     std::to_string(e.line()) +
                                     ": registerClient: client guid is missing!"));
  }
  EXPECT_THAT([&] { session->registerClient("GUID-N", ""); },
              ThrowsMessage<vtc::AssertionFailure>("registerClient: client name is missing!"));
  // A policy that carries on registers nothing either.
  vtc::setAssertionPolicy(vtc::AssertionPolicy::Continue);
  EXPECT_FALSE(session->registerClient("", "Nameless"));
  vtc::setAssertionPolicy(vtc::AssertionPolicy::Throw);
  EXPECT_EQ(logged.messages("Error").size(), 3u);
  EXPECT_EQ(proxy.requests().size(), sent);
  EXPECT_FALSE(std::filesystem::exists(share.diskPath(session->clientsPath() + "/.client")));
  EXPECT_FALSE(VTCPrefsCenter::defaultCenter().clientGuid());
}

TEST_F(RegistryEdges, EntityTagsCompareWithoutTheWeakPrefix) {
  std::string tag = session->getDataclassInfo("Contacts").get("DAV:getetag").string();
  ASSERT_FALSE(tag.empty());
  std::string bare = tag.starts_with("W/") ? tag.substr(2) : tag;
  EXPECT_FALSE(session->eTagChangedForDataclass("Contacts", bare));
  EXPECT_FALSE(session->eTagChangedForDataclass("Contacts", "W/" + bare));
  EXPECT_TRUE(session->eTagChangedForDataclass("Contacts", "\"something-else\""));
  EXPECT_TRUE(session->eTagChangedForDataclass("Unknown", "eTagNotFound"));  // find failed
}

// A dataclass name names one collection below the schemas, never another
// place: a name that could reach elsewhere, or that is no plain name, is
// refused before any request, and a member of the schemas collection that
// names no dataclass is left out of the listing.
TEST_F(RegistryEdges, ANameThatIsNoPlainDataclassNameReachesNothing) {
  const size_t sent = proxy.requests().size();
  const std::vector<SyncEngineChange> changes{
      SyncEngineChange(SyncEngineChange::kAdd, "r1", vtc::Array{})};
  for (const std::string& bad :
       std::vector<std::string>{"../../evil", "a/b", "..", ".hidden", "", "tab\tname", "x..y",
                                "caf\xc3\xa9", std::string(101, 'a')}) {
    EXPECT_THROW(session->getDataclassInfo(bad), std::invalid_argument) << bad;
    EXPECT_THROW(session->lockDataclass(bad), std::invalid_argument) << bad;
    EXPECT_THROW(session->commitChanges(changes, bad, 1, false), std::invalid_argument) << bad;
    EXPECT_THROW(session->setStatus("normal", "GUID-A", bad), std::invalid_argument) << bad;
    EXPECT_THROW(session->downloadChangeLogsForDataclass(bad, home.path()), std::invalid_argument)
        << bad;
  }
  EXPECT_EQ(proxy.requests().size(), sent);
  EXPECT_NO_THROW(session->changeLogPathForDataclass("com.korvo.Contacts-2_b", 1));

  session->getDataclassInfo("Contacts");
  std::filesystem::create_directories(share.diskPath(schemas + "/not plain"));
  EXPECT_EQ(session->dataclassNames(), std::vector<std::string>{"Contacts"});
}

}  // namespace
