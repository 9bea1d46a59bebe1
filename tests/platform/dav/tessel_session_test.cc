// The WebDAV layer against a real Apache share: outcomes mapped to result
// codes, properties, moves, transfers, listings and locks between sessions.
#include <gtest/gtest.h>

#include <fstream>
#include <iterator>

#include "VantorSyncManager/MemberAccount.h"
#include "VantorSyncManager/PublicNames.h"
#include "platform/dav/TesselSession.h"
#include "localshare/ApacheShare.h"
#include "support/TestHome.h"

namespace {

const std::string kNs = "http://nubilo.example/ns/sync/";

class DavLayer : public ::testing::Test {
 protected:
  vtc::test::TestHome home;
  vtc::local::ApacheShare share;
  const std::string base = "/Web/My Folder";  // a path that needs escaping

  std::unique_ptr<TesselSession> connect(const std::string& password = "wonderland", int port = 0) {
    auto account = MemberAccount::accountWithName("alice", password, "VantorClient/-/-/488");
    int p = port ? port : share.port();
    account->setServer("http", "127.0.0.1", p, "/");
    auto s = std::make_unique<TesselSession>(account, "alice", "127.0.0.1", p, "http");
    s->_setReadTimeOut(5);
    return s;
  }

  void SetUp() override { ASSERT_TRUE(connect()->makeCollectionAtPath(base, true).isSuccessful()); }
};

TEST_F(DavLayer, OutcomesMapToResultCodes) {
  auto dav = connect();
  // Locking a missing resource is not found, and leaves nothing behind.
  const std::string ghost = base + "/ghost.client";
  for (const DavTransaction& missing :
       {dav->_lockResourceAtPath(ghost, 60, "<x/>"), dav->basicAttributesAtPath(ghost)}) {
    EXPECT_FALSE(missing.isSuccessful());
    EXPECT_EQ(missing.errorType(), kNBResourceNotFound);
    EXPECT_EQ(missing.httpStatusCode(), 404);
    EXPECT_EQ(missing.transactionState(), 3);
  }

  DavTransaction refused = connect("wrong")->basicAttributesAtPath(base);
  EXPECT_EQ(refused.errorType(), kNBInvalidCredentials);
  EXPECT_EQ(refused.httpStatusCode(), 401);
  EXPECT_EQ(refused.transactionState(), 3);

  DavTransaction down = connect("wonderland", vtc::local::freeLoopbackPort())->getDataAtPath("/x");
  EXPECT_EQ(down.errorType(), kNBNetworkError);
  EXPECT_NE(down.transactionState(), 3);
  EXPECT_EQ(down.httpStatusCode(), vtc::kNoHTTPStatus);

  // A credentials check answers a refusal as a successful "no".
  auto account = MemberAccount::accountWithName("alice", "wrong", "ua");
  account->setServer("http", "127.0.0.1", share.port(), "/");
  DavTransaction check = account->credentialsAreValid();
  EXPECT_TRUE(check.isSuccessful());
  EXPECT_FALSE(check.result().boolean());
  EXPECT_EQ(check.errorType(), kNBInvalidCredentials);
}

TEST_F(DavLayer, PropertiesAreSetReadAndRemovedUnderEscapedPaths) {
  auto dav = connect();
  const std::string dir = base + "/Data Class/";
  ASSERT_TRUE(dav->makeCollectionAtPath(dir, false).isSuccessful());
  vtc::Dictionary props{{"displayname", "A <b> & \"c\""}, {"maxversion", "00007"}};
  ASSERT_TRUE(dav->_issuePropPatchAtPath(dir, props, kNs).isSuccessful());

  DavTransaction read = dav->_issuePropFindAtPath(dir, 0, {});
  ASSERT_TRUE(read.isSuccessful());
  const vtc::Dictionary& result = read.result().dictionary();
  ASSERT_EQ(result.size(), 1u);
  const std::string href = "/Web/My%20Folder/Data%20Class/";
  EXPECT_EQ(result.begin()->first, href);  // keyed by the href as the server sent it
  const vtc::Dictionary& found = result.begin()->second.dictionary();
  EXPECT_EQ(found.get(kNs + "displayname").string(), "A <b> & \"c\"");
  EXPECT_EQ(found.get(kNs + "maxversion").string(), "00007");
  EXPECT_TRUE(found.contains("DAV:getetag"));

  ASSERT_TRUE(dav->_issuePropPatchAtPath(dir, {{"maxversion", kNBRemoveProp}}, kNs).isSuccessful());
  DavTransaction named = dav->_issuePropFindAtPath(dir, 0, {kNs + "maxversion"});
  ASSERT_TRUE(named.isSuccessful());
  EXPECT_FALSE(named.result().dictionary().get(href).dictionary().contains(kNs + "maxversion"));
}

TEST_F(DavLayer, TransfersMovesAndListings) {
  auto dav = connect();
  const std::string first = base + "/00001.clog", second = base + "/00002.clog";
  vtc::Bytes body{'h', 'e', 'l', 'l', 'o', ' ', 'd', 'a', 'v'};
  ASSERT_TRUE(dav->putData(body, first).isSuccessful());
  EXPECT_EQ(dav->getDataAtPath(first).result().data(), body);

  DavTransaction range = dav->getDataAtPath(first, std::nullopt, 6, 8, std::nullopt);
  EXPECT_EQ(range.httpStatusCode(), 206);
  EXPECT_EQ(range.result().data(), (vtc::Bytes{'d', 'a', 'v'}));

  std::string local = home.path() + "/copy.clog";
  ASSERT_TRUE(dav->getDataAtPath(first, std::nullopt, 0, 0, local).isSuccessful());
  std::ifstream in(local, std::ios::binary);
  EXPECT_EQ(vtc::Bytes(std::istreambuf_iterator<char>(in), {}), body);
  ASSERT_TRUE(dav->putLocalFileAtPath(local, second).isSuccessful());

  // Without overwrite an existing target answers 412; with it, the move goes through.
  DavTransaction refused = dav->moveResourceAtPath(second, first, false);
  EXPECT_FALSE(refused.isSuccessful());
  EXPECT_EQ(refused.httpStatusCode(), 412);
  EXPECT_TRUE(dav->moveResourceAtPath(second, first).isSuccessful());

  // The listing holds the members only, with their attributes.
  DavTransaction list = dav->listCollectionAtPath(base);
  ASSERT_TRUE(list.isSuccessful());
  ASSERT_EQ(list.result().array().size(), 1u);
  const vtc::Dictionary& entry = list.result().array()[0].dictionary();
  EXPECT_EQ(entry.get(kNBURI).string(), first);
  EXPECT_EQ(entry.get(kNBContentLength).integer(), 9);
  EXPECT_EQ(entry.get(kNBLastModified).kind(), vtc::Value::Kind::Date);
  EXPECT_TRUE(dav->deleteResourceAtPath(first).isSuccessful());
  EXPECT_EQ(dav->deleteResourceAtPath(first).errorType(), kNBResourceNotFound);
}

TEST_F(DavLayer, LocksGuardMembersAndShowTheirOwnerWhole) {
  auto a = connect();
  auto b = connect();
  const std::string target = base + "/";
  const std::string owner = "<SY:synclockinfo xmlns:SY='" + kNs +
                            "'><SY:lock-user>alice</SY:lock-user><SY:clientid>" +
                            std::string(200, 'C') +
                            "</SY:clientid><SY:clientname>Alice &amp; Co</SY:clientname>"
                            "<SY:acquiredate>2026-11-22 10:00:00 +0000</SY:acquiredate>"
                            "</SY:synclockinfo>";
  ASSERT_TRUE(a->_lockResourceAtPath(target, 60, owner).isSuccessful());
  EXPECT_TRUE(a->holdsLockOnPath(target));

  // The holder writes under its lock; the other session is refused.
  EXPECT_TRUE(a->putData({'1'}, base + "/00001.clog").isSuccessful());
  EXPECT_FALSE(b->putData({'2'}, base + "/00002.clog").isSuccessful());
  EXPECT_FALSE(b->_lockResourceAtPath(target, 60, "<x/>").isSuccessful());

  DavTransaction ext = b->extendedAttributesAtPath(target);
  ASSERT_TRUE(ext.isSuccessful());
  const vtc::Array& locks = ext.result().dictionary().get(vtc::kDavLockDiscovery).array();
  ASSERT_EQ(locks.size(), 1u);
  EXPECT_EQ(locks[0].dictionary().get("clientid").string(), std::string(200, 'C'));
  EXPECT_EQ(locks[0].dictionary().get("clientname").string(), "Alice & Co");
  EXPECT_EQ(locks[0].dictionary().get("acquiredate").string(), "2026-11-22 10:00:00 +0000");

  EXPECT_TRUE(a->_relockResourceAtPath(target, 60, owner).isSuccessful());
  EXPECT_FALSE(b->_unlockResourceAtPath(target).isSuccessful());  // b holds nothing
  EXPECT_TRUE(a->_unlockResourceAtPath(target).isSuccessful());
  EXPECT_FALSE(a->holdsLockOnPath(target));
  EXPECT_TRUE(b->putData({'2'}, base + "/00002.clog").isSuccessful());
}

}  // namespace
