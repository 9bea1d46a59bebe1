// Opening sessions against a real share: the sync area (on each server),
// the login and network failures, HTTPS trust and pinning, the lock owner
// text and the one persistent connection.
#include <gmock/gmock.h>

#include <algorithm>
#include <cstdlib>
#include <filesystem>
#include <optional>
#include <set>
#include <stdexcept>

#include "VantorSyncManager/NubiloException.h"
#include "VantorSyncManager/PublicNames.h"
#include "common/SecretMemory.h"
#include "localshare/ApacheShare.h"
#include "platform/dav/TesselSession.h"
#include "support/Failures.h"
#include "support/ShareTest.h"

using testing::HasSubstr;
using testing::ThrowsMessage;
using vtc::local::ApacheShare;
using vtc::test::ThrowsFailure;

namespace {

// Sets an environment variable for the life of the object.
struct ScopedEnv {
  const char* name;
  std::optional<std::string> previous;

  ScopedEnv(const char* n, const std::string& value) : name(n) {
    if (const char* v = std::getenv(n)) previous = v;
    ::setenv(n, value.c_str(), 1);
  }
  ~ScopedEnv() { previous ? ::setenv(name, previous->c_str(), 1) : ::unsetenv(name); }
};

using SessionSetup = vtc::test::ShareTest;
using SyncArea = vtc::test::OnEachServer<vtc::test::ShareTest>;
INSTANTIATE_TEST_SUITE_P(Servers, SyncArea,
                         testing::Values(vtc::local::ShareKind::Apache,
                                         vtc::local::ShareKind::Sabre,
                                         vtc::local::ShareKind::SabreUnderPath),
                         vtc::test::serverName);

// On a share that begins below the server's root, the whole layout lies
// under that root.
TEST_P(SyncArea, CreatesTheSyncAreaNotesTheRespondingServerAndRemovesTheArea) {
  // A session that only looks changes nothing.
  openSession(vtc::Dictionary{{"create_sync_paths", false}});
  EXPECT_FALSE(std::filesystem::exists(share.diskPath("/Library")));

  auto session = openSession();
  std::string sync = ApacheShare::kSyncPath;
  EXPECT_EQ(session->shareRoot(), share.shareRoot().empty() ? "/" : share.shareRoot());
  EXPECT_EQ(session->clientsPath(), share.shareRoot() + sync + "/Clients");
  EXPECT_EQ(session->schemasPath(), share.shareRoot() + sync + "/Schemas");
  EXPECT_EQ(session->respondingServer(), share.respondingServer());
  EXPECT_EQ(logged.count("Info", std::string("Responding server: ") + share.respondingServer()),
            1u);
  EXPECT_EQ(session->eventUUID().size(), 36u);
  EXPECT_TRUE(time.sleeps().empty());

  // A second session finds the area in place; it holds the two collections
  // and nothing else.
  auto second = openSession();
  EXPECT_TRUE(second->createSyncPaths());
  EXPECT_EQ(share.members(sync), (std::set<std::string>{"Clients/", "Schemas/"}));

  EXPECT_TRUE(second->removeSyncPaths());
  EXPECT_FALSE(std::filesystem::exists(share.diskPath(sync)));
  EXPECT_TRUE(std::filesystem::is_directory(share.diskPath("/Library/Application Support")));
}

TEST_F(SessionSetup, AWrongPasswordFailsAtOnceAndAServerDownAfterRetriesThroughTheSleeper) {
  vtc::Dictionary config = share.configuration();
  EXPECT_THAT(
      [&] { NubiloRemoteSession::sessionWithUsername("alice", "not-the-password", config); },
      ThrowsMessage<NubiloException>(
          "NubiloLoginFailureException: Failed to validate credentials for alice"));
  EXPECT_TRUE(time.sleeps().empty());
  EXPECT_TRUE(traces.records().empty());
  EXPECT_EQ(
      logged.messages("Error"),
      std::vector<std::string>{"Failed to validate credentials for alice, Raising exception"});

  vtc::Dictionary down{{"host_port", vtc::local::freeLoopbackPort()}};
  EXPECT_THAT([&] { openSession(down); },
              ThrowsMessage<NubiloException>(
                  "NubiloNetworkFailureException: Failed to validate credentials for alice"));
  // Four checks in all: three pauses of lock_acquire_sleep_seconds.
  EXPECT_EQ(time.sleeps(), (std::vector<double>{4, 4, 4}));
  auto retries = traces.withDomain("com.korvo.sync.nubilosession.retrytransaction");
  ASSERT_EQ(retries.size(), 4u);  // three retries and the final report
  EXPECT_EQ(traces.field(retries[0], "COM_KORVO_MESSAGE_VALUE"), "1");
  EXPECT_EQ(traces.field(retries[2], "COM_KORVO_MESSAGE_VALUE"), "3");
  auto finals = traces.withDomain("com.korvo.sync.nubilosession.retrytransaction.final");
  ASSERT_EQ(finals.size(), 2u);  // the last retry is final, and so is the closing report
  EXPECT_EQ(traces.field(finals[1], "COM_KORVO_MESSAGE_SIGNATURE"), "Raised Exception");
  EXPECT_EQ(traces.field(retries[0], "COM_KORVO_MESSAGE_EVENT"),
            traces.field(finals[1], "COM_KORVO_MESSAGE_EVENT"));
  std::vector<std::string> warnings = logged.messages("Warning");
  ASSERT_EQ(warnings.size(), 3u);
  EXPECT_THAT(warnings[0], testing::MatchesRegex("Failed to validate credentials due to error "
                                                 "<DavTransaction .*>, retrying\\.\\.\\."));
  EXPECT_EQ(logged.messages("Error").back(),
            "Failed to validate credentials due to NetworkError for alice, Raising exception");

  // With no retries allowed, the one check is all.
  down.set("max_lock_acquire_attempts", 0);
  EXPECT_THAT([&] { openSession(down); }, ThrowsFailure(NubiloNetworkFailureException));
  EXPECT_EQ(time.sleeps().size(), 3u);
  retries = traces.withDomain("com.korvo.sync.nubilosession.retrytransaction");
  ASSERT_EQ(retries.size(), 5u);
  EXPECT_EQ(traces.field(retries[4], "COM_KORVO_MESSAGE_VALUE"), "0");
}

TEST_F(SessionSetup, MissingServerKeysAreNamedNotCrashed) {
  for (const char* key : {"sync_path", "host_name"}) {
    vtc::Dictionary config = share.configuration();
    config.erase(key);
    EXPECT_THAT([&] { NubiloRemoteSession::sessionWithUsername("alice", "wonderland", config); },
                ThrowsMessage<std::invalid_argument>(HasSubstr(key)));
  }
}

TEST_F(SessionSetup, HttpsTrustsWhatTheAuthoritiesVouchForOrThePinnedCertificateAlone) {
  ApacheShare tls(ApacheShare::Options{.tls = true});
  vtc::Dictionary config = tls.configuration();
  auto open = [&] {
    return NubiloRemoteSession::sessionWithUsername("alice", "wonderland", config);
  };
  // Unknown authority: refused at once, and no credentials go to it.
  const auto refused = ThrowsMessage<NubiloException>(
      "NubiloLoginFailureException: Failed to validate credentials for alice");
  EXPECT_THAT(open, refused);
  EXPECT_TRUE(time.sleeps().empty());
  EXPECT_EQ(tls.accessEntries().size(), 0u);
  std::string digest;
  {
    ScopedEnv trust("SSL_CERT_FILE", tls.caFile());  // the system's store, pointed at our authority
    auto session = open();
    EXPECT_EQ(session->respondingServer(), "dav-test-1");
    digest = session->tesselSession().serverCertificateDigest();
  }
  EXPECT_THAT(digest, testing::MatchesRegex("([0-9a-f]{2}:){31}[0-9a-f]{2}"));
  config.set("tls_ca_file", tls.caFile());  // an authority of the server's own
  EXPECT_EQ(open()->tesselSession().serverCertificateDigest(), digest);

  // Pinned, the certificate is trusted with no authority at all, and a new
  // one is not, whoever signed it.
  config.erase("tls_ca_file");
  config.set("tls_pinned_certificate", digest);
  EXPECT_EQ(open()->respondingServer(), "dav-test-1");
  tls.renewCertificate();
  config.set("tls_ca_file", tls.caFile());
  EXPECT_THAT(open, refused);
  EXPECT_TRUE(time.sleeps().empty());
}

TEST_F(SessionSetup, LockOwnerTextQuotesNamesButNotTheClientId) {
  auto session = openSession({{"ClientName", "Bob's \"Mac\" <&>"}, {"ClientGuid", "G&1"}});
  const std::string& owner = session->lockOwnerFormatString();
  EXPECT_THAT(owner,
              testing::AllOf(
                  HasSubstr("<SY:clientname>Bob's &quot;Mac&quot; &lt;&amp;&gt;</SY:clientname>"),
                  HasSubstr("<SY:clientid>G&1</SY:clientid>"),
                  HasSubstr("xmlns:SY='http://nubilo.example/ns/sync/'"),
                  HasSubstr("<SY:acquiredate>%@</SY:acquiredate>")));
  EXPECT_EQ(owner.find("%@"), owner.rfind("%@"));
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
  EXPECT_FALSE(vtc::processIsDumpable());  // while it holds the password
  session.reset();
  EXPECT_TRUE(vtc::processIsDumpable());
  auto log = share.accessEntries();
  std::set<int> ports;
  for (const auto& e : log) ports.insert(e.clientPort);
  EXPECT_EQ(ports.size(), 1u);
  // After the first answer the credentials go with every request.
  EXPECT_EQ(std::count_if(log.begin(), log.end(), [](auto& e) { return e.status == 401; }), 1);
  EXPECT_GE(log.size(), 9u);  // check (401 + retry), collections, put, attributes, listing, locks
}

}  // namespace
