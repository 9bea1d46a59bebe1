// VTCPrefsCenter on real preference files, a private session bus and a real
// Secret Service.
#include <gmock/gmock.h>

#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <sstream>

#include "VantorSyncManager/NubiloException.h"
#include "VantorSyncManager/NubiloRemoteSession.h"
#include "VantorSyncManager/PublicNames.h"
#include "VantorSyncManager/VTCPrefsCenter.h"
#include "common/Logging.h"
#include "localshare/ApacheShare.h"
#include "platform/engine/SyncEngine.h"
#include "platform/prefs/PreferenceStore.h"
#include "platform/secrets/CredentialStore.h"
#include "support/FakeTime.h"
#include "support/LogCapture.h"
#include "support/SessionBus.h"
#include "support/TestHome.h"

using testing::HasSubstr;
using vtc::prefs::PreferenceStore;
using vtc::prefs::Scope;

namespace {

class PrefsCenter : public ::testing::Test {
 protected:
  vtc::test::TestHome home;
  vtc::test::FakeTime time;
  VTCPrefsCenter& prefs = VTCPrefsCenter::defaultCenter();

  vtc::Value perHost(const std::string& key) {
    PreferenceStore::shared().synchronize(kVantorDefaultsKey, Scope::CurrentHost);
    return PreferenceStore::shared().copyValue(key, kVantorDefaultsKey, Scope::CurrentHost);
  }
  void setPerHost(const std::string& key, vtc::Value v) {
    PreferenceStore::shared().setValue(key, std::move(v), kVantorDefaultsKey, Scope::CurrentHost);
  }
};

TEST_F(PrefsCenter, FailureGuardsCountUpAFailedTagExpiresAndASuccessClearsThemAll) {
  vtc::test::LogCapture logged;
  prefs.setSyncSuccessful(false, "Contacts");
  prefs.setSyncSuccessful(false, "Contacts");
  EXPECT_EQ(prefs.failedSyncCountForDataclass("Contacts"), 2);
  EXPECT_FALSE(prefs.lastSuccessfulSyncDateForDataclass("Contacts"));
  EXPECT_EQ(prefs.lastAttemptedSyncDateForDataclass("Contacts"), time.now());
  std::vector<int64_t> counts;
  for (int anchor : {12, 12, 12, 13, 13}) {
    prefs.setDownloadedAnchorClog(vtc::Value(anchor), "Contacts");
    counts.push_back(prefs.repeatedDownloadCountForDataclass("Contacts"));
  }
  EXPECT_EQ(counts, (std::vector<int64_t>{0, 1, 2, 0, 1}));  // a new anchor starts again
  EXPECT_EQ(perHost("anchorClog.Contacts").integer(), 13);
  prefs.setDownloadedAnchorClog(vtc::Value(12), "Calendars");
  // A failed tag is believed for the configured time only.
  PreferenceStore::shared().setValue("inconsistency_ttl", vtc::Value(60), kVantorDefaultsKey,
                                     Scope::AnyHost);
  prefs.setFailedETag("\"abc\"", "Contacts");
  EXPECT_EQ(perHost("etagTTL.Contacts").date(), time.now() + std::chrono::seconds(60));
  EXPECT_THAT(logged.messages("Info"),
              testing::Contains(testing::StartsWith(
                  "Storing failed etag \"abc\" for dataclass Contacts with TTL date of 20")));
  time.advance(vtc::Seconds(59));
  EXPECT_EQ(prefs.failedETagForDataclass("Contacts"), "\"abc\"");
  time.advance(vtc::Seconds(2));
  EXPECT_FALSE(prefs.failedETagForDataclass("Contacts"));  // expired: not believed, but kept
  EXPECT_EQ(perHost("etag.Contacts").string(), "\"abc\"");

  prefs.setSyncSuccessful(true, "Contacts");
  EXPECT_EQ(prefs.lastSuccessfulSyncDateForDataclass("Contacts"), time.now());
  for (const char* key :
       {"FailedCount.Contacts", "etag.Contacts", "anchorClog.Contacts", "anchorCount.Contacts"})
    EXPECT_TRUE(perHost(key).isNone()) << key;
  EXPECT_EQ(perHost("anchorClog.Calendars").integer(), 12);  // other dataclasses untouched
}

TEST_F(PrefsCenter, AClientNameIsStoredWithoutControlCharacters) {
  prefs.setClientName("Alice's\tMac\x07\n");
  EXPECT_EQ(prefs.clientName(), "Alice'sMac");
  EXPECT_EQ(perHost("ClientName").string(), "Alice'sMac");  // on disk too
}

TEST_F(PrefsCenter, ModesDefaultToSixAndAreSeenAcrossProcessesAfterAResync) {
  EXPECT_EQ(prefs.syncModeForDataclass("Contacts"), 6);
  prefs.setSyncMode(2, "Contacts");
  EXPECT_EQ(prefs.syncModeForDataclass("Contacts"), 2);
  pid_t child = ::fork();
  if (child == 0) {
    PreferenceStore::shared().resetForTesting();
    VTCPrefsCenter::defaultCenter().setSyncMode(4, "Contacts");
    ::_exit(0);
  }
  ::waitpid(child, nullptr, 0);
  EXPECT_EQ(prefs.syncModeForDataclass("Contacts"), 2);
  EXPECT_EQ(prefs.synchronizedSyncModeForDataclass("Contacts"), 4);
}

TEST_F(PrefsCenter, TheSyncSwitchReadsStringsNumbersAndBooleans) {
  struct Case {
    vtc::Value stored;
    bool on;
  } cases[] = {{vtc::Value(), false},     {vtc::Value("YES"), true}, {vtc::Value("yes"), false},
               {vtc::Value("1"), true},   {vtc::Value(1), true},     {vtc::Value(true), true},
               {vtc::Value(false), false}};
  for (const Case& c : cases) {
    setPerHost("ShouldSyncWithServer", c.stored);
    EXPECT_EQ(prefs.syncTurnedOn(), c.on) << c.stored.description();
  }
  prefs.setSyncTurnedOn(true);
  EXPECT_EQ(perHost("ShouldSyncWithServer"), vtc::Value(true));
}

TEST_F(PrefsCenter, QueuedDataclassesAreFilesThatAClearingReadRemoves) {
  std::string folder = home.path() + "/.cache/com.korvo.nubilo.queueddataclasses";
  EXPECT_TRUE(prefs.queueDataclasses({}));
  EXPECT_FALSE(std::filesystem::exists(folder));
  EXPECT_FALSE(prefs.getQueuedDataclasses(false));
  EXPECT_TRUE(prefs.queueDataclasses({"Contacts", "Calendars", "Contacts"}));
  EXPECT_EQ(prefs.getQueuedDataclasses(false), (std::vector<std::string>{"Calendars", "Contacts"}));
  EXPECT_EQ(prefs.getQueuedDataclasses(true), (std::vector<std::string>{"Calendars", "Contacts"}));
  EXPECT_EQ(prefs.getQueuedDataclasses(true), std::vector<std::string>{});
}

TEST_F(PrefsCenter, AResetKeepsTheLogLevel) {
  setPerHost("LoggingLevel", vtc::Value("debug"));
  prefs.setClientGuid("G");
  prefs.resetPreferences();
  EXPECT_EQ(PreferenceStore::shared().copyKeyList(kVantorDefaultsKey, Scope::CurrentHost),
            std::vector<std::string>{"LoggingLevel"});
  EXPECT_FALSE(prefs.clientGuid());
}

TEST_F(PrefsCenter, TheLastSyncDateIsMigratedOnceFromTheEngineAndAnnouncedWhenSet) {
  const vtc::Date older = time.now() - std::chrono::hours(3);
  {
    auto engine = vtc::engine::SyncEngine::open();
    engine->registerClient("com.korvo.VantorSync", vtc::Dictionary{});
    engine->setObjectForKey("com.korvo.VantorSync", "lastSuccessSync", vtc::Value(older));
  }
  EXPECT_EQ(prefs.lastSuccessfulSyncDate(), older);
  EXPECT_EQ(perHost("lastSuccessSync").date(), older);
  EXPECT_TRUE(vtc::engine::SyncEngine::open()
                  ->objectForKey("com.korvo.VantorSync", "lastSuccessSync")
                  .isNone());

  vtc::test::SessionBus bus;
  vtc::test::NotificationListener listener;
  prefs.setLastSuccessfulSyncDate(time.now());
  auto got = listener.waitFor(std::chrono::milliseconds(1000));
  ASSERT_EQ(got.size(), 1u);
  EXPECT_EQ(got[0].name, "com.korvo.VantorSync.lastSyncDateChanged");
  EXPECT_EQ(prefs.lastSuccessfulSyncDate(), time.now());
}

TEST_F(PrefsCenter, ASessionOpensFromThePreferencesAndTheKeyringOrTheLogSaysHowToStoreIt) {
  PreferenceStore::shared().setValue("KitbagMember", vtc::Value("alice"), kVantorDefaultsKey,
                                     Scope::AnyHost);
  {
    vtc::test::SessionBus bus;
    bus.startKeyring();
    vtc::local::ApacheShare share;
    ASSERT_TRUE(vtc::secrets::storeGenericPassword("Kitbag", "alice", "Nubilo", "wonderland"));
    EXPECT_EQ(prefs.username(), "alice");
    EXPECT_EQ(prefs.objectForKey("Password"), vtc::Value("wonderland"));
    NubiloRemoteSession::sessionFromPreferencesWithConfiguration(share.configuration());
    EXPECT_TRUE(std::filesystem::is_directory(
        share.diskPath(std::string(vtc::local::ApacheShare::kSyncPath) + "/Clients")));
  }
  // Without a Secret Service on the bus the login fails before any request.
  vtc::test::SessionBus bus;
  EXPECT_THAT(
      [] {
        NubiloRemoteSession::sessionFromPreferencesWithConfiguration(
            vtc::Dictionary{{"user_agent", "VantorClient/-/-/488"}});
      },
      testing::ThrowsMessage<NubiloException>(std::string(NubiloLoginFailureException) +
                                              ": Failed to obtain credentials"));
  std::stringstream log;
  log << std::ifstream(vtc::log::logFilePath()).rdbuf();
  EXPECT_THAT(
      log.str(),
      testing::AllOf(
          HasSubstr("secret-tool store --label=Nubilo service Kitbag account alice"),
          HasSubstr("Failed to obtain credentials from Preferences for VantorClient/-/-/488")));
}

}  // namespace
