// Opening sessions against a real Apache share: the sync area, the login and
// network failures, the lock owner text and the one persistent connection.
#include <gtest/gtest.h>

#include <sys/stat.h>

#include <set>
#include <stdexcept>

#include "VantorSyncManager/NubiloException.h"
#include "VantorSyncManager/NubiloRemoteSession.h"
#include "VantorSyncManager/PublicNames.h"
#include "platform/dav/TesselSession.h"
#include "support/ApacheShare.h"
#include "support/FakeTime.h"
#include "support/ShareTest.h"
#include "support/TestHome.h"
#include "support/TraceCapture.h"

using vtc::test::ApacheShare;

namespace {

bool isDirectory(const std::string& path) {
  struct stat st {};
  return ::stat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
}

class SessionSetup : public vtc::test::ShareTest {
 protected:
  std::unique_ptr<NubiloRemoteSession> open(vtc::Dictionary config,
                                            const std::string& password = "wonderland") {
    return NubiloRemoteSession::sessionWithUsername("alice", password, config);
  }
};

TEST_F(SessionSetup, CreatesTheSyncAreaAndNotesTheRespondingServer) {
  auto session = openSession();
  std::string sync = ApacheShare::kSyncPath;
  EXPECT_EQ(session->clientsPath(), sync + "/Clients");
  EXPECT_EQ(session->schemasPath(), sync + "/Schemas");
  EXPECT_TRUE(isDirectory(share.diskPath(sync + "/Clients")));
  EXPECT_TRUE(isDirectory(share.diskPath(sync + "/Schemas")));
  ASSERT_TRUE(session->respondingServer());
  EXPECT_EQ(*session->respondingServer(), "dav-test-1");
  EXPECT_EQ(session->eventUUID().size(), 36u);
  EXPECT_TRUE(time.sleeps().empty());

  // A second session finds the area in place, and sees it through the share.
  auto second = openSession();
  EXPECT_TRUE(second->createSyncPaths());
  DavTransaction listing = second->tesselSession().listCollectionAtPath(sync);
  ASSERT_TRUE(listing.isSuccessful());
  std::set<std::string> members;
  for (const auto& entry : listing.result().array())
    members.insert(entry.dictionary().get(kNBURI).string());
  EXPECT_EQ(members, (std::set<std::string>{sync + "/Clients/", sync + "/Schemas/"}));
}

TEST_F(SessionSetup, WrongPasswordIsALoginFailureWithoutRetries) {
  try {
    open(share.configuration(), "not-the-password");
    FAIL() << "no exception";
  } catch (const NubiloException& e) {
    EXPECT_EQ(e.name(), NubiloLoginFailureException);
    EXPECT_EQ(e.reason(), "Failed to validate credentials for alice");
  }
  EXPECT_TRUE(time.sleeps().empty());
  EXPECT_TRUE(traces.records().empty());
}

TEST_F(SessionSetup, ServerDownIsRetriedThroughTheSleeperThenANetworkFailure) {
  vtc::Dictionary config = share.configuration();
  config.set("host_port", vtc::Value(vtc::test::freeLoopbackPort()));
  try {
    open(config);
    FAIL() << "no exception";
  } catch (const NubiloException& e) {
    EXPECT_EQ(e.name(), NubiloNetworkFailureException);
    EXPECT_EQ(e.reason(), "Failed to validate credentials for alice");
  }
  // Four checks in all: three pauses of lock_acquire_sleep_seconds.
  EXPECT_EQ(time.sleeps(), (std::vector<double>{4, 4, 4}));
  auto retries = traces.withDomain("com.korvo.sync.nubilosession.retrytransaction");
  ASSERT_EQ(retries.size(), 4u);  // three retries and the final report
  EXPECT_EQ(traces.field(retries[0], "COM_KORVO_MESSAGE_VALUE"), "1");
  EXPECT_EQ(traces.field(retries[2], "COM_KORVO_MESSAGE_VALUE"), "3");
  EXPECT_EQ(traces.field(retries[0], "MESSAGE"), "Timeout failure while validating credentials");
  EXPECT_EQ(traces.field(retries[3], "MESSAGE"), "Failure to validate credentials");
  auto finals = traces.withDomain("com.korvo.sync.nubilosession.retrytransaction.final");
  ASSERT_EQ(finals.size(), 2u);  // the last retry is final, and so is the closing report
  EXPECT_EQ(traces.field(finals[1], "COM_KORVO_MESSAGE_SIGNATURE"), "Raised Exception");
  EXPECT_EQ(traces.field(retries[0], "COM_KORVO_MESSAGE_EVENT"),
            traces.field(finals[1], "COM_KORVO_MESSAGE_EVENT"));
}

TEST_F(SessionSetup, NoRetriesWhenMaxAttemptsIsZero) {
  vtc::Dictionary config = share.configuration();
  config.set("host_port", vtc::Value(vtc::test::freeLoopbackPort()));
  config.set("max_lock_acquire_attempts", vtc::Value(0));
  EXPECT_THROW(open(config), NubiloException);
  EXPECT_TRUE(time.sleeps().empty());
  auto retries = traces.withDomain("com.korvo.sync.nubilosession.retrytransaction");
  ASSERT_EQ(retries.size(), 1u);
  EXPECT_EQ(traces.field(retries[0], "COM_KORVO_MESSAGE_VALUE"), "0");
}

TEST_F(SessionSetup, MissingServerKeysAreNamedNotCrashed) {
  for (const char* key : {"sync_path", "host_name"}) {
    vtc::Dictionary config = share.configuration();
    config.erase(key);
    try {
      open(config);
      FAIL() << key;
    } catch (const std::invalid_argument& e) {
      EXPECT_NE(std::string(e.what()).find(key), std::string::npos) << e.what();
    }
  }
}

TEST_F(SessionSetup, LockOwnerTextQuotesNamesButNotTheClientId) {
  vtc::Dictionary config = share.configuration();
  config.set("ClientName", vtc::Value("Bob's \"Mac\" <&>"));
  config.set("ClientGuid", vtc::Value("G&1"));
  auto session = open(config);
  const std::string& owner = session->lockOwnerFormatString();
  EXPECT_NE(owner.find("<SY:clientname>Bob's &quot;Mac&quot; &lt;&amp;&gt;</SY:clientname>"),
            std::string::npos)
      << owner;
  EXPECT_NE(owner.find("<SY:clientid>G&1</SY:clientid>"), std::string::npos);
  EXPECT_NE(owner.find("xmlns:SY='http://nubilo.example/ns/sync/'"), std::string::npos);
  EXPECT_EQ(owner.find("%@"), owner.rfind("%@"));
  EXPECT_NE(owner.find("<SY:acquiredate>%@</SY:acquiredate>"), std::string::npos);
}

TEST_F(SessionSetup, AllRequestsOfASessionShareOneConnection) {
  auto session = openSession();
  TesselSession& dav = session->tesselSession();
  dav.putData({'x'}, session->clientsPath() + "/probe.client");
  dav.basicAttributesAtPath(session->clientsPath() + "/probe.client");
  dav.listCollectionAtPath(session->clientsPath());
  session->lockClients();  // locks too: neon's own would open a connection each
  session->relockClients();
  session->unlockClients();
  session.reset();
  std::set<int> ports;
  size_t requests = 0, challenges = 0;
  for (const auto& e : share.accessEntries()) {
    ports.insert(e.clientPort);
    ++requests;
    challenges += e.status == 401;
  }
  EXPECT_EQ(challenges, 1u);  // after the first answer the credentials go with every request
  EXPECT_GE(requests, 9u);    // check (401 + retry), collections, put, attributes, listing, locks
  EXPECT_EQ(ports.size(), 1u);
}

TEST_F(SessionSetup, RemoveSyncPathsDeletesTheArea) {
  auto session = openSession();
  EXPECT_TRUE(session->removeSyncPaths());
  EXPECT_FALSE(isDirectory(share.diskPath(ApacheShare::kSyncPath)));
  EXPECT_TRUE(isDirectory(share.diskPath("/Library/Application Support")));
}

}  // namespace
