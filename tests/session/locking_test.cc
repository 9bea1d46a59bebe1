// Locking between two sessions on a real share: contention with back-off,
// the holder's owner record, bookkeeping, release, relock and unlock.
#include <gtest/gtest.h>

#include <algorithm>

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

class Locking : public vtc::test::ShareTest {
 protected:
  std::unique_ptr<NubiloRemoteSession> open(const std::string& guid, const std::string& name,
                                            int attempts = 3) {
    vtc::Dictionary overrides = clientOverrides(guid);
    overrides.set("ClientName", name);
    overrides.set("max_lock_acquire_attempts", attempts);
    auto s = openSession(overrides);
    // Registration is a later step; here a client is just its resource.
    s->tesselSession().putData({}, s->clientsPath() + "/" + guid + ".client");
    s->tesselSession().makeCollectionAtPath(s->schemasPath() + "/Contacts", false);
    return s;
  }

  size_t lockRequests(int status) const {
    auto entries = share.accessEntries();
    return std::count_if(entries.begin(), entries.end(),
                         [&](const auto& e) { return e.method == "LOCK" && e.status == status; });
  }
};

TEST_F(Locking, AContenderWaitsOutItsAttemptsAndLearnsWhoHoldsTheLock) {
  auto a = open("GUID-A", "Alice's Mac");
  auto b = open("GUID-B", "Bob's Mac");
  a->lockDataclass("Contacts");
  EXPECT_TRUE(traces.records().empty());
  try {
    b->lockDataclass("Contacts");
    FAIL() << "no exception";
  } catch (const NubiloException& e) {
    EXPECT_EQ(e.name(), NubiloLockFailureException);
    EXPECT_EQ(e.reason(), "Failed to lock resource, " + b->schemasPath() + "/Contacts/");
    const vtc::Array& locks = e.userInfo().get("DAV:lockdiscovery").array();
    ASSERT_EQ(locks.size(), 1u) << e.userInfo().description();
    EXPECT_EQ(locks[0].dictionary().get("clientid").string(), "GUID-A");
    EXPECT_EQ(locks[0].dictionary().get("clientname").string(), "Alice's Mac");
  }
  EXPECT_EQ(lockRequests(423), 4u);  // max attempts + 1
  std::vector<double> pauses = time.sleeps();
  ASSERT_EQ(pauses.size(), 3u);
  for (size_t i = 0; i < pauses.size(); ++i) {
    EXPECT_LE(pauses[i], 90.0);
    if (i > 0) {
      EXPECT_GE(pauses[i], pauses[i - 1]);
    }
  }
  auto reports = traces.withDomain("com.korvo.sync.nubilosession.retrytransaction");
  ASSERT_EQ(reports.size(), 3u);
  for (size_t i = 0; i < reports.size(); ++i)
    EXPECT_EQ(traces.field(reports[i], "COM_KORVO_MESSAGE_VALUE"), std::to_string(i));
  EXPECT_TRUE(traces.withDomain("com.korvo.sync.nubilosession.retrytransaction.final").empty());
  EXPECT_TRUE(b->lockedResources().empty());

  // Once the holder lets go, the contender gets the lock at once.
  a->unlockDataclass("Contacts");
  EXPECT_TRUE(a->lockedResources().empty());
  b->lockDataclass("Contacts");
  EXPECT_EQ(time.sleeps().size(), 3u);
  EXPECT_EQ(b->lockedResources(), std::set<std::string>{b->schemasPath() + "/Contacts/"});
}

TEST_F(Locking, WithNoRetriesOneRefusalFailsAtOnce) {
  auto a = open("GUID-A", "A");
  auto b = open("GUID-B", "B", /*attempts=*/0);
  a->lockClients();
  EXPECT_THROW(b->lockClients(), NubiloException);
  EXPECT_EQ(lockRequests(423), 1u);
  EXPECT_TRUE(time.sleeps().empty());
  EXPECT_TRUE(traces.records().empty());
}

TEST_F(Locking, AReleasedSessionUnlocksWhatItHeld) {
  auto a = open("GUID-A", "A");
  auto b = open("GUID-B", "B", /*attempts=*/0);
  a->lockClient();
  a->lockDataclasses();
  EXPECT_EQ(a->lockedResources(),
            (std::set<std::string>{a->clientsPath() + "/GUID-A.client", a->schemasPath() + "/"}));
  EXPECT_THROW(b->lockClient("GUID-A"), NubiloException);
  a.reset();
  b->lockClient("GUID-A");
  b->lockDataclasses();
  EXPECT_EQ(b->lockedResources().size(), 2u);
}

TEST_F(Locking, MissingTargetsAndTheClientTranslation) {
  auto a = open("GUID-A", "A");
  try {
    a->lockClient("NOBODY");
    FAIL() << "no exception";
  } catch (const NubiloException& e) {
    EXPECT_EQ(e.name(), NubiloClientRegistrationException);
    EXPECT_EQ(e.reason(), "Attempting to lock a client that doesn't exist, NOBODY");
  }
  try {
    a->lockDataclass("Unregistered");
    FAIL() << "no exception";
  } catch (const NubiloException& e) {
    EXPECT_EQ(e.name(), NubiloResourceNotFoundException);
  }
  EXPECT_TRUE(time.sleeps().empty());
  EXPECT_EQ(traces.withDomain("com.korvo.sync.nubilosession.retrytransaction.final").size(), 2u);
  a->unlockClient("NOBODY");  // logged, never raised
}

TEST_F(Locking, ALockTheServerForgotCannotBeRenewedNorReleased) {
  auto a = open("GUID-A", "A");
  a->lockDataclass("Contacts");
  a->relockDataclass("Contacts");
  share.forgetLocks();  // as if the lock had timed out
  try {
    a->relockDataclass("Contacts");
    FAIL() << "no exception";
  } catch (const NubiloException& e) {
    EXPECT_EQ(e.name(), NubiloRelockFailureException);
    EXPECT_EQ(e.reason(), "Failed to relock resource, " + a->schemasPath() + "/Contacts/");
  }
  auto finals = traces.withDomain("com.korvo.sync.nubilosession.retrytransaction.final");
  ASSERT_EQ(finals.size(), 1u);
  EXPECT_EQ(traces.field(finals[0], "MESSAGE"), "Failed to relock resource");
  a->unlockDataclass("Contacts");
  EXPECT_EQ(a->lockedResources().size(), 1u);  // kept for the release to try again
}

}  // namespace
