// What the session does when the server or the network misbehaves, with a
// fault-injecting proxy in front of a real share.
#include <gtest/gtest.h>

#include <algorithm>

#include "VantorSyncManager/NubiloException.h"
#include "VantorSyncManager/NubiloRemoteSession.h"
#include "VantorSyncManager/PublicNames.h"
#include "platform/dav/TesselSession.h"
#include "support/ApacheShare.h"
#include "support/FakeTime.h"
#include "support/FaultProxy.h"
#include "support/ShareTest.h"
#include "support/TestHome.h"
#include "support/TraceCapture.h"

using vtc::test::FaultProxy;
using vtc::test::Match;
using vtc::test::TraceCapture;

namespace {

constexpr const char* kRetry = "com.korvo.sync.nubilosession.retrytransaction";
constexpr const char* kFinal = "com.korvo.sync.nubilosession.retrytransaction.final";

class Faults : public vtc::test::ShareTest {
 protected:
  FaultProxy proxy{share.port()};
  std::unique_ptr<NubiloRemoteSession> session;

  void SetUp() override { session = open("GUID-A"); }

  std::unique_ptr<NubiloRemoteSession> open(const std::string& guid, int attempts = 3) {
    return openSession(vtc::Dictionary{{"host_port", proxy.port()},
                                       {"sync_dav_timeout_seconds", 1},  // neon's smallest time-out
                                       {"max_lock_acquire_attempts", attempts},
                                       {"guid", guid}});
  }
  std::string schemas() const { return session->schemasPath(); }
  size_t seen(const std::string& method, const std::string& path) const {
    auto all = proxy.requests();
    return std::count_if(all.begin(), all.end(),
                         [&](const auto& s) { return s.method == method && s.path == path; });
  }
};

TEST_F(Faults, ATimeOutIsTriedOnceMoreAndTheSecondAnswerReturnedAsItIs) {
  std::string path = schemas() + "/";
  proxy.timeOut({"PROPFIND", path, 0});
  DavTransaction t = session->_issuePropFindWithRetryAtPath(path, kDAVZeroDepth, {});
  EXPECT_EQ(t.errorType(), kNBTimeoutError);
  EXPECT_EQ(seen("PROPFIND", path), 2u);
  auto reports = traces.withDomain(kRetry);
  ASSERT_EQ(reports.size(), 1u);
  EXPECT_EQ(TraceCapture::field(reports[0], "COM_KORVO_MESSAGE_VALUE"), "0");
  EXPECT_TRUE(traces.withDomain(kFinal).empty());
}

TEST_F(Faults, ANetworkFailureOnTheRetryAfterATimeOutIsReturnedNotRaised) {
  std::string path = schemas() + "/x.clog";
  proxy.timeOut({"PUT", path, 1});
  proxy.dropConnection({"PUT", path, 0});
  DavTransaction t = session->putDataWithRetry({'x'}, path);
  EXPECT_EQ(t.errorType(), kNBNetworkError);
  EXPECT_TRUE(time.sleeps().empty());
}

TEST_F(Faults, OtherFailuresAreNeitherRetriedNorReported) {
  std::string path = schemas() + "/full.clog";
  proxy.answer({"PUT", path, 0}, 507);
  DavTransaction t = session->putDataWithRetry({'x'}, path);
  EXPECT_EQ(t.errorType(), kNBInsufficientStorage);
  EXPECT_EQ(t.httpStatusCode(), 507);
  EXPECT_EQ(seen("PUT", path), 1u);
  EXPECT_TRUE(traces.records().empty());

  proxy.dropConnection({"PROPPATCH", "", 0});
  try {
    session->_issuePropPatchWithRetryAtPath(schemas() + "/", vtc::Dictionary{{"a", "b"}},
                                            session->syncNamespace());
    FAIL() << "no exception";
  } catch (const NubiloException& e) {
    EXPECT_EQ(e.name(), NubiloNetworkFailureException);
    EXPECT_EQ(e.reason().rfind("PropPatch transaction failed due to network error, <", 0), 0u);
  }
}

TEST_F(Faults, ALockRefusedThenCutOffRaisesANetworkFailureAfterOnePause) {
  session->tesselSession().makeCollectionAtPath(schemas() + "/Contacts", false);
  proxy.answer({"LOCK", schemas() + "/Contacts/", 1}, 423);
  proxy.dropConnection({"LOCK", schemas() + "/Contacts/", 0});
  try {
    session->lockDataclass("Contacts");
    FAIL() << "no exception";
  } catch (const NubiloException& e) {
    EXPECT_EQ(e.name(), NubiloNetworkFailureException);
    EXPECT_EQ(e.reason().rfind("Lock transaction failed due to network error, ", 0), 0u);
  }
  EXPECT_EQ(time.sleeps().size(), 1u);
  ASSERT_EQ(traces.withDomain(kFinal).size(), 1u);
  EXPECT_EQ(TraceCapture::field(traces.withDomain(kRetry).back(), "COM_KORVO_MESSAGE_VALUE"), "1");
}

TEST_F(Faults, AnUnlockIsTriedTwiceAndItsPathKeptWhenBothFail) {
  const std::string target = schemas() + "/Contacts/";
  session->tesselSession().makeCollectionAtPath(schemas() + "/Contacts", false);
  session->lockDataclass("Contacts");
  proxy.answer({"UNLOCK", target, 0}, 500);
  session->unlockDataclass("Contacts");
  EXPECT_EQ(seen("UNLOCK", target), 2u);
  EXPECT_EQ(session->lockedResources().count(target), 1u);
  EXPECT_TRUE(time.sleeps().empty());
  proxy.clear();
  session.reset();  // the release tries once more, and gets through
  EXPECT_EQ(seen("UNLOCK", target), 3u);
  EXPECT_EQ(proxy.requests().back().action, "forwarded");
}

TEST_F(Faults, ARefusedMoveMakesTheResetDeleteChangelogByChangelogRenewingItsLocks) {
  std::string dc = "Contacts";
  session->getDataclassInfo(dc);
  session->lockDataclass(dc);
  for (int i = 3; i <= 8; ++i)
    session->tesselSession().putData({'c'}, session->changeLogPathForDataclass(dc, i));
  session->setInfoForDataclass(vtc::Dictionary{{"minversion", "00003"}, {"maxversion", "00008"}},
                               dc);
  proxy.answer({"MOVE", schemas() + "/" + dc, 0}, 500);
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
  EXPECT_TRUE(session->lockedResources().count(schemas() + "/" + dc + "/"));
  ASSERT_EQ(traces.withDomain(kRetry).size(), 1u);
  EXPECT_EQ(TraceCapture::field(traces.withDomain(kRetry)[0], "MESSAGE"),
            "Failed to move dataclass aside for reset");
}

TEST_F(Faults, RecordReadsNameTheAccountsTrouble) {
  session->registerClient("GUID-A", "A");
  std::string client = session->clientsPath() + "/GUID-A.client";
  struct Case {
    int status;
    const char* name;
  } cases[] = {{402, NubiloAccountExpiredException},
               {508, NubiloAccountMigratedException},
               {500, NubiloTransactionFailureException}};
  for (const Case& c : cases) {
    proxy.clear();
    proxy.answer({"PROPFIND", client, 0}, c.status);
    try {
      session->getClientInfo("GUID-A");
      FAIL() << c.status;
    } catch (const NubiloException& e) {
      EXPECT_EQ(e.name(), c.name) << c.status;
    }
  }
  proxy.clear();
  proxy.answer({"PROPFIND", schemas() + "/Contacts/", 0}, 402);
  try {
    session->getDataclassInfo("Contacts");
    FAIL() << "no exception";
  } catch (const NubiloException& e) {
    EXPECT_EQ(e.name(), NubiloAccountExpiredException);
  }
}

TEST_F(Faults, RegistrationWaitsOutAuthorizationFailuresThenWrites) {
  auto b = open("GUID-B", /*attempts=*/2);
  std::string client = b->clientsPath() + "/GUID-B.client";
  proxy.answer({"PROPFIND", client, 0}, 401);
  EXPECT_TRUE(b->registerClient("GUID-B", "Bob"));
  EXPECT_EQ(time.sleeps(), (std::vector<double>{30, 30}));
  auto finals = traces.withDomain(kFinal);
  ASSERT_EQ(finals.size(), 1u);
  EXPECT_EQ(TraceCapture::field(finals[0], "MESSAGE"), "Failed to get basic attributes on Client");
  proxy.clear();
  EXPECT_EQ(b->getClientInfo("GUID-B").get("clientname").string(), "Bob");

  proxy.answer({"DELETE", client, 0}, 500);
  EXPECT_FALSE(b->unregisterClient("GUID-B"));
}

}  // namespace
