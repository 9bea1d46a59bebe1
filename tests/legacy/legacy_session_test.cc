// The older session interface against a real share: sessions, registration
// and the account's clients with their dates; the members kept inert or
// reported as no longer functional.
#include <gmock/gmock.h>

#include <cerrno>
#include <filesystem>

#include "VantorSyncManager/AssertionHandler.h"
#include "VantorSyncManager/LegacySession.h"
#include "VantorSyncManager/NubiloRemoteSession.h"
#include "VantorSyncManager/PublicNames.h"
#include "VantorSyncManager/VTCPrefsCenter.h"
#include "support/Failures.h"
#include "support/SharePreferences.h"
#include "support/ShareTest.h"

using testing::ElementsAre;
using testing::ThrowsMessage;
using vtc::test::ThrowsFailure;

namespace {

using namespace std::chrono;

vtc::Date utc(int y, unsigned m, unsigned d, int h, int min, int s, int ms = 0) {
  return time_point_cast<vtc::Date::duration>(sys_days(year(y) / month(m) / day(d)) + hours(h) +
                                              minutes(min) + seconds(s) + milliseconds(ms));
}

class Legacy : public vtc::test::ShareTest {
 protected:
  void SetUp() override { vtc::test::storeShareInPreferences(share); }
  void TearDown() override { vtc::setAssertionPolicy(vtc::AssertionPolicy::Throw); }

  std::unique_ptr<SMSession> connect() {
    std::unique_ptr<SMSession> session;
    EXPECT_EQ(SMSession::configuredSessionForUsername("alice", "wonderland", &session, false), 0);
    return session;
  }
  // Writes sync dates into a client's record, as its own computer would.
  void setDates(const std::string& guid, const vtc::Dictionary& dates) {
    openSession()->setInfoForClient(dates, guid);
  }
  static const SMClientInfo& find(const std::vector<SMClientInfo>& clients,
                                  const std::string& guid) {
    for (const SMClientInfo& c : clients)
      if (c.guid() == guid) return c;
    throw std::runtime_error("no client " + guid);
  }
};

TEST_F(Legacy, ClientsAreRegisteredListedWithTheirDatesAndUnregistered) {
  auto session = connect();
  ASSERT_TRUE(session);
  // An empty account leaves the slot empty, whatever it held.
  std::optional<std::vector<SMClientInfo>> clients{std::vector<SMClientInfo>{}};
  EXPECT_EQ(session->getAccountClients(&clients), 0);
  EXPECT_FALSE(clients);

  for (const char* guid : {"GUID-B", "GUID-C", "GUID-D"})
    EXPECT_EQ(session->registerClient(SMClientInfo(std::string(guid) + "'s Mac", std::nullopt,
                                                   std::nullopt, std::string(guid))),
              0);
  SMClientInfo own = SMClientInfo::defaultClientWithName("My Mac");
  const std::string ownGuid = *own.guid();
  EXPECT_EQ(session->registerClient(own), 0);  // the last registered is this computer
  setDates(ownGuid, {{"lastsync", "2011-03-04 10:20:30 +0100"}});
  setDates("GUID-B", {{"lastsync", "2011-03-04 10:20:30 +0100"},
                      {"firstsync", "2011-03-04 10:20:30.250 +0100"}});
  setDates("GUID-C", {{"lastsync", "2011-03-04 10:20:30.250 +0100"},
                      {"firstsync", "2011-01-02 03:04:05 -0800"}});
  setDates("GUID-D", {{"lastsync", "last tuesday"}});
  const vtc::Date lastHere = time.now() - hours(1);
  VTCPrefsCenter::defaultCenter().setLastSuccessfulSyncDate(lastHere);

  EXPECT_EQ(session->getAccountClients(&clients), 0);
  ASSERT_TRUE(clients);
  ASSERT_EQ(clients->size(), 4u);
  const SMClientInfo& mine = find(*clients, ownGuid);
  EXPECT_EQ(mine.lastSyncDate(), lastHere);  // not what the record says
  EXPECT_EQ(mine.name(), "My Mac");
  EXPECT_EQ(mine.className(), "bramble");
  EXPECT_EQ(mine.buildVersion(), "VantorSyncClient-488.5");
  const SMClientInfo& b = find(*clients, "GUID-B");
  EXPECT_EQ(b.lastSyncDate(), utc(2011, 3, 4, 9, 20, 30));
  EXPECT_FALSE(b.firstSyncDate());  // milliseconds are read for the last sync only
  const SMClientInfo& c = find(*clients, "GUID-C");
  EXPECT_EQ(c.lastSyncDate(), utc(2011, 3, 4, 9, 20, 30, 250));
  EXPECT_EQ(c.firstSyncDate(), utc(2011, 1, 2, 11, 4, 5));
  EXPECT_FALSE(find(*clients, "GUID-D").lastSyncDate());
  EXPECT_EQ(logged.messages("Warning"),
            std::vector<std::string>{"Could not interperet date from string last tuesday"});

  EXPECT_EQ(session->unregisterClient(b), 0);  // the list is replaced below
  EXPECT_EQ(session->getAccountClients(&clients), 0);
  EXPECT_EQ(clients->size(), 3u);
  SMClientInfo again("Carol's Mac", std::nullopt, std::nullopt, std::string("GUID-C"));
  EXPECT_THAT([&] { session->registerClient(again); },
              ThrowsFailure(NubiloClientRegistrationException));
}

TEST_F(Legacy, SessionFailuresReachTheCallerAndAClientWithoutGuidIsNotRegistered) {
  std::unique_ptr<SMSession> session;
  EXPECT_THAT([&] { SMSession::configuredSessionForUsername("alice", "wrong", &session, true); },
              ThrowsFailure(NubiloLoginFailureException));
  EXPECT_FALSE(session);
  EXPECT_EQ(SMSession::configuredSessionForUsername("alice", "wonderland", nullptr, true), 1);

  session = connect();
  SMClientInfo nameless(std::make_shared<vtc::Dictionary>(vtc::Dictionary{{"clientname", "X"}}));
  EXPECT_THAT([&] { session->registerClient(nameless); },
              ThrowsMessage<vtc::AssertionFailure>("registerClient: client guid is missing!"));
  EXPECT_FALSE(std::filesystem::exists(
      share.diskPath(std::string(vtc::local::Share::kSyncPath) + "/Clients/.client")));
}

TEST_F(Legacy, InertMembersSendNothingAndRetiredOnesReportTheirUse) {
  auto session = connect();
  size_t requests = share.accessEntries().size();
  SMClientInfo client = SMClientInfo::defaultClientWithName("Mac");
  std::optional<SMClientInfo> found;
  vtc::Array changes{vtc::Value("untouched")};
  EXPECT_EQ(session->login() + session->logout() + session->registerDataclass("Contacts") +
                session->resetDataclass("Contacts") + session->unregisterDataclass("Contacts") +
                session->resetClient(client) + session->updateClient(client) +
                session->getRegisteredClient(*client.guid(), &found) +
                session->getChangeInfoForDataclass("Contacts", 3, &changes),
            0);
  EXPECT_FALSE(found);
  EXPECT_EQ(changes.size(), 1u);
  EXPECT_EQ(share.accessEntries().size(), requests);
  EXPECT_EQ(SMResult::resultCodeFromPosixError(ENOENT), 1);
  EXPECT_FALSE(SMResult::localizedErrorFromCodeAndArgs(3, "x", 4));

  // A client made from DAV attributes reads the caller's dictionary itself;
  // a default client has a fresh identity.
  auto attributes = std::make_shared<vtc::Dictionary>();
  SMClientInfo shared(attributes);
  attributes->set("clientname", vtc::Value("Later"));
  EXPECT_EQ(shared.name(), "Later");
  EXPECT_NE(client.guid(), SMClientInfo::defaultClientWithName("Mac").guid());
  EXPECT_EQ(client.guid()->size(), 36u);
  EXPECT_FALSE(client.buildVersion());

  try {
    SMDataclassInfo().syncMode();
    FAIL() << "no assertion";
  } catch (const vtc::AssertionFailure& e) {
    EXPECT_EQ(e.what(),
              std::string("SMDataclassInfo is no longer functional and should not be used"));
    EXPECT_EQ(e.className(), "SMDataclassInfo");
    EXPECT_EQ(e.file(), "SMDataclassInfo.cc");
  }
  vtc::setAssertionPolicy(vtc::AssertionPolicy::Continue);
  EXPECT_EQ(SMDataclassInfo("Contacts", "Contacts").syncMode(), -1);
  client.setName("Renamed");
  EXPECT_EQ(client.name(), "Mac");
  EXPECT_FALSE(client.versionForDataclass("Contacts"));
  std::vector<std::string> errors = logged.messages("Error");
  ASSERT_EQ(errors.size(), 5u);
  EXPECT_THAT(errors[2], testing::MatchesRegex("Assertion failure in SMDataclassInfo::syncMode, "
                                               "SMDataclassInfo\\.cc:[0-9]+: SMDataclassInfo is "
                                               "no longer functional and should not be used"));
  EXPECT_THAT(errors[3], testing::EndsWith(": SMClientInfo setName: is no longer functional and "
                                           "should not be used"));
  EXPECT_THAT(errors[4], testing::EndsWith(": SMClientInfo setversionForDataclass: is no longer "
                                           "functional and should not be used"));
}

}  // namespace
