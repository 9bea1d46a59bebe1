// Periodic sync and sync on change on VTCPrefsCenter: the job description
// files are the truth, the units follow them, and every launcher failure is
// an Error line, never a raise. The user manager is a stand-in that records
// its calls, except in the two cases that run the real `systemctl`.
#include <gmock/gmock.h>

#include <stdlib.h>
#include <unistd.h>

#include <chrono>
#include <ctime>
#include <filesystem>
#include <iostream>

#include "VantorSyncManager/PublicNames.h"
#include "VantorSyncManager/SyncStatus.h"
#include "VantorSyncManager/VTCPrefsCenter.h"
#include "localshare/Computer.h"
#include "platform/jobs/JobLauncher.h"
#include "platform/jobs/UnitFiles.h"
#include "platform/jobs/UserManager.h"
#include "platform/plist/PlistCodec.h"
#include "platform/prefs/PreferenceStore.h"
#include "prefs/AutoSyncJobs.h"
#include "support/FakeTime.h"
#include "support/LogCapture.h"
#include "support/TestHome.h"
#include "support/UserManagerStandIn.h"

using testing::ElementsAre;
using testing::HasSubstr;
using testing::StartsWith;
using vtc::Dictionary;
using vtc::Value;
using vtc::local::Computer;
using vtc::prefs::PreferenceStore;
using vtc::prefs::Scope;

namespace {

constexpr const char* kLabel = "com.korvo.NubiloSyncClientAgent";

class AutoSync : public ::testing::Test {
 protected:
  vtc::test::TestHome home;
  vtc::test::LogCapture logged;
  vtc::test::FakeTime time;
  vtc::test::UserManagerStandIn manager;
  VTCPrefsCenter& prefs = VTCPrefsCenter::defaultCenter();
  std::string units = home.path() + "/.config/systemd/user/";

  std::tm local() const {
    const std::time_t t = std::chrono::system_clock::to_time_t(time.now());
    std::tm tm{};
    localtime_r(&t, &tm);
    return tm;
  }
  Value job() const {
    return vtc::plist::readFile(vtc::autosync::periodicJobFile()).value_or(Value());
  }
  Dictionary calendar() const {
    return job().dictionary().get("StartCalendarInterval").dictionary();
  }
  void turnOn(int32_t interval, int32_t unit) {
    prefs.setAutoSyncInterval(interval);
    prefs.setAutoSyncUnit(unit);
    prefs.setAutoSyncOn(true);
  }
  Value perHost(const std::string& key) {
    PreferenceStore::shared().synchronize(kVantorDefaultsKey, Scope::CurrentHost);
    return PreferenceStore::shared().copyValue(key, kVantorDefaultsKey, Scope::CurrentHost);
  }
  std::string enableCall(const std::vector<std::string>& names) const {
    std::string call = "enable --now --no-block";
    for (const std::string& n : names) call += " " + units + n;
    return call;
  }
};

// Each unit's length makes the period; which calendar a period gets is
// checked against systemd's own reading in unit_files_test.
TEST_F(AutoSync, EachUnitGivesItsPeriodAndSubmittingNeverWaitsForTheJob) {
  const std::tm now = local();
  struct Case {
    int32_t interval, unit;
    Dictionary calendar;
  } cases[] = {
      {2, 0, Dictionary{{"Minute", now.tm_min}}},                         // minutes: hourly
      {2, 1, Dictionary{{"Hour", now.tm_hour}, {"Minute", now.tm_min}}},  // hours: daily
      {2, 2, Dictionary{{"Weekday", now.tm_wday}, {"Hour", now.tm_hour}, {"Minute", now.tm_min}}},
      {30, 3, Dictionary{}},  // seconds: every minute
  };
  for (const Case& c : cases) {
    turnOn(c.interval, c.unit);
    EXPECT_EQ(calendar(), c.calendar) << c.interval << " in unit " << c.unit;
    prefs.setAutoSyncOn(false);
  }

  // The job runs at load, and its first sync fails: neither is the caller's.
  manager.forgetCalls();
  manager.failStartedJobs();
  turnOn(1, 2);
  EXPECT_TRUE(prefs.autoSyncOn());
  const Dictionary d = job().dictionary();
  EXPECT_EQ(d.get("Label").string(), kLabel);
  EXPECT_THAT(d.get("ProgramArguments").array(),
              ElementsAre(testing::Property(&Value::string, testing::EndsWith("/nubilosyncclient")),
                          Value("--sync"), Value("--periodic")));
  EXPECT_EQ(d.get("LimitLoadToSessionType").string(), "Glaze");
  EXPECT_TRUE(d.get("RunAtLoad").boolean());
  EXPECT_THAT(Computer::read(units + kLabel + ".timer"),
              HasSubstr("OnCalendar=" + *vtc::jobs::onCalendar(calendar()) + "\n"));
  EXPECT_THAT(manager.calls(),
              ElementsAre("daemon-reload", enableCall({std::string(kLabel) + ".service",
                                                       std::string(kLabel) + ".timer"})));
  EXPECT_TRUE(logged.messages("Error").empty());
}

TEST_F(AutoSync, OnlyAChangeInTheNumberOfCalendarEntriesRewritesTheJob) {
  turnOn(2, 1);
  const std::string written = Computer::read(vtc::autosync::periodicJobFile());
  manager.forgetCalls();
  time.advance(vtc::Seconds(3660));
  turnOn(5, 1);  // also daily: kept at the first hour and minute
  EXPECT_EQ(Computer::read(vtc::autosync::periodicJobFile()), written);
  EXPECT_TRUE(manager.calls().empty());

  turnOn(1, 1);  // hourly: one entry instead of two
  EXPECT_EQ(calendar(), (Dictionary{{"Minute", local().tm_min}}));
  const std::string service = std::string(kLabel) + ".service",
                    timer = std::string(kLabel) + ".timer";
  EXPECT_THAT(manager.calls(),
              ElementsAre("disable --now " + service + " " + timer, "daemon-reload",
                          "daemon-reload", enableCall({service, timer})));
}

TEST_F(AutoSync, OffRemovesJobAndUnitsOffWithoutAJobAndIntervalZeroOnlyStoreTheChoice) {
  turnOn(1, 2);
  manager.forgetCalls();
  prefs.setAutoSyncOn(false);
  EXPECT_FALSE(prefs.autoSyncOn());
  EXPECT_FALSE(std::filesystem::exists(units + kLabel + ".timer"));
  EXPECT_FALSE(std::filesystem::exists(units + kLabel + ".service"));
  EXPECT_THAT(manager.calls(),
              ElementsAre(std::string("disable --now ") + kLabel + ".service " + kLabel + ".timer",
                          "daemon-reload"));
  EXPECT_FALSE(perHost("AutoSyncOn").boolean());

  manager.forgetCalls();
  prefs.setAutoSyncOn(false);
  prefs.setAutoSyncInterval(0);
  prefs.setAutoSyncOn(true);
  EXPECT_TRUE(manager.calls().empty());
  EXPECT_FALSE(prefs.autoSyncOn());
  EXPECT_TRUE(perHost("AutoSyncOn").boolean());  // the choice is kept all the same
}

TEST_F(AutoSync, TheOlderSchedulersEntryGoesWhenTheChoiceWasOnButNoJobFileExists) {
  const std::string other = "0 3 * * * /usr/bin/backup\n";
  manager.crontab =
      other + "*/30 * * * * /usr/bin/nubilosyncclient --sync # com.korvo.VantorSync AutoSync\n";
  PreferenceStore::shared().setValue("AutoSyncOn", Value(true), kVantorDefaultsKey,
                                     Scope::CurrentHost);
  turnOn(1, 1);
  EXPECT_EQ(manager.crontab, other);
  EXPECT_TRUE(prefs.autoSyncOn());

  const size_t crontabCalls = manager.crontabCalls().size();
  turnOn(1, 2);  // the job file exists now: cron is not asked again
  EXPECT_EQ(manager.crontabCalls().size(), crontabCalls);

  // Without cron there is no older scheduler and nothing to say.
  prefs.setAutoSyncOn(false);
  PreferenceStore::shared().setValue("AutoSyncOn", Value(true), kVantorDefaultsKey,
                                     Scope::CurrentHost);
  manager.crontabInstalled = false;
  turnOn(1, 1);
  EXPECT_TRUE(logged.messages("Warning").empty());
}

TEST_F(AutoSync, WithoutAUserManagerFailuresAreErrorLinesAndTheJobFileStaysTheTruth) {
  // The real systemctl, with nowhere to find a manager: a container or a
  // bare SSH login.
  vtc::jobs::systemctlSeam().install(nullptr);
  const std::string runtime = home.path() + "/runtime";
  std::filesystem::create_directories(runtime);
  const char* previousRuntime = std::getenv("XDG_RUNTIME_DIR");
  const std::string keptRuntime = previousRuntime ? previousRuntime : "";
  const char* previousBus = std::getenv("DBUS_SESSION_BUS_ADDRESS");
  const std::string keptBus = previousBus ? previousBus : "";
  setenv("XDG_RUNTIME_DIR", runtime.c_str(), 1);
  unsetenv("DBUS_SESSION_BUS_ADDRESS");
  std::cout << "[ jobs ] the no-manager path runs here, with the real systemctl\n";

  EXPECT_NO_THROW(turnOn(1, 1));
  EXPECT_TRUE(prefs.autoSyncOn());
  EXPECT_TRUE(std::filesystem::exists(units + kLabel + ".timer"));
  ASSERT_EQ(logged.messages("Error").size(), 1u);
  EXPECT_THAT(logged.messages("Error")[0],
              StartsWith("Failed with systemctl --user daemon-reload: "));
  EXPECT_THAT(logged.messages("Error")[0], HasSubstr(std::string(" to submit job to taskd ")));
  EXPECT_THAT(logged.messages("Error")[0], HasSubstr(kLabel));

  EXPECT_NO_THROW(prefs.setAutoSyncOn(false));
  EXPECT_FALSE(prefs.autoSyncOn());
  EXPECT_FALSE(std::filesystem::exists(units + kLabel + ".timer"));
  ASSERT_EQ(logged.messages("Error").size(), 2u);
  EXPECT_THAT(logged.messages("Error")[1],
              StartsWith("Failed to remove job from taskd systemctl --user disable --now"));

  if (previousRuntime)
    setenv("XDG_RUNTIME_DIR", keptRuntime.c_str(), 1);
  else
    unsetenv("XDG_RUNTIME_DIR");
  if (previousBus) setenv("DBUS_SESSION_BUS_ADDRESS", keptBus.c_str(), 1);
}

TEST_F(AutoSync, ARealUserManagerStartsAJobThatRunsAtLoadWithoutWaitingForIt) {
  vtc::jobs::systemctlSeam().install(nullptr);
  if (vtc::jobs::systemctl({"show-environment"}).status != 0)
    GTEST_SKIP() << "no user manager here (a container or a bare login): only the no-manager "
                    "path ran";
  std::cout << "[ jobs ] a real user manager runs here\n";
  const std::string label = "com.korvo.VantorSyncTest" + std::to_string(::getpid());
  std::string error;
  // A first run that takes a while and fails, as a failing sync does.
  const auto start = std::chrono::steady_clock::now();
  ASSERT_TRUE(vtc::jobs::jobSubmit(
      Dictionary{{"Label", Value(label)},
                 {"ProgramArguments", Value(vtc::Array{"/bin/sh", "-c", "sleep 3; exit 3"})},
                 {"RunAtLoad", true},
                 {"StartCalendarInterval", Value(Dictionary{{"Minute", 7}})}},
      error))
      << error;
  EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(2));
  EXPECT_EQ(vtc::jobs::systemctl({"is-enabled", label + ".timer"}).status, 0);
  EXPECT_TRUE(vtc::jobs::jobRemove(label, true, error)) << error;
  EXPECT_NE(vtc::jobs::systemctl({"is-enabled", label + ".timer"}).status, 0);
}

TEST_F(AutoSync, SyncOnChangeInstallsTheBookmarksJobOnceAndLeavesItWhenTurnedOff) {
  // The engine has no record of this client yet: the choice is kept, and
  // takes effect once the client is registered.
  prefs.setAutomaticallySyncOn(true);
  EXPECT_TRUE(prefs.automaticallySyncOn());
  EXPECT_TRUE(logged.messages("Error").empty());
  auto client = getVantorClient();  // registered with the installed description
  ASSERT_TRUE(client);
  EXPECT_EQ(client->clientIdentifier(), kVantorSyncClientId);
  EXPECT_TRUE(client->description().get("Dataclasses").dictionary().contains("com.korvo.Contacts"));
  EXPECT_EQ(getNubiloClient()->objectForKey("SyncsAfterClients"), Value(true));
  EXPECT_EQ(getVanterConfiguration().get("sync_namespace"),
            prefs.configuration().get("sync_namespace"));
  EXPECT_FALSE(prefs.checkBookmarksPlistAndCreateIfNecessary());  // no browser
  EXPECT_FALSE(std::filesystem::exists(vtc::autosync::bookmarksJobFile()));

  Computer::write(home.path() + "/.local/share/applications/com.korvo.Voyager.SyncClient.desktop",
                  "[Desktop Entry]\nType=Application\nPath=" + home.path() + "/Voyager.app\n");
  manager.forgetCalls();
  prefs.setAutomaticallySyncOn(true);
  const Dictionary d =
      vtc::plist::readFile(vtc::autosync::bookmarksJobFile()).value_or(Value()).dictionary();
  EXPECT_EQ(d.get("Label").string(), "com.korvo.Voyager");
  EXPECT_EQ(d.get("ProgramArguments").array().at(0).string(),
            home.path() + "/Voyager.app/Contents/Crestos/VoyagerSyncClient");
  EXPECT_EQ(d.get("WatchPaths").array().at(0).string(),
            home.path() + "/Library/Voyager/Bookmarks.plist");
  EXPECT_EQ(d.get("ThrottleInterval").integer(), 60);
  EXPECT_FALSE(d.get("RunAtLoad").boolean());
  EXPECT_THAT(manager.calls(),
              ElementsAre("daemon-reload", enableCall({"com.korvo.Voyager.path"})));

  manager.forgetCalls();
  EXPECT_TRUE(prefs.checkBookmarksPlistAndCreateIfNecessary());
  EXPECT_TRUE(manager.calls().empty());
  prefs.setAutomaticallySyncOn(false);
  EXPECT_FALSE(prefs.automaticallySyncOn());
  EXPECT_EQ(client->objectForKey("SyncsAfterClients"), Value(false));
  EXPECT_TRUE(std::filesystem::exists(vtc::autosync::bookmarksJobFile()));

  // A refused submission is an Error line and still a yes; a folder in the
  // job file's place is a no.
  std::filesystem::remove(vtc::autosync::bookmarksJobFile());
  manager.refuse(1, "Failed to connect to bus");
  EXPECT_TRUE(prefs.checkBookmarksPlistAndCreateIfNecessary());
  EXPECT_THAT(logged.messages("Error"),
              ElementsAre(StartsWith("Failed with systemctl --user daemon-reload: Failed to "
                                     "connect to bus (status 1) to submit job to taskd")));
  std::filesystem::remove(vtc::autosync::bookmarksJobFile());
  std::filesystem::create_directories(vtc::autosync::bookmarksJobFile());
  EXPECT_FALSE(prefs.checkBookmarksPlistAndCreateIfNecessary());
}

TEST_F(AutoSync, TheAutomaticIntervalAndTheNextTriggerDate) {
  prefs.setClientGuid("11111111-2222-3333-4444-555555555555");
  prefs.resetConfigurationForTesting();
  EXPECT_EQ(prefs.automaticallySyncInterval(), 60);  // 3600 / 60 against 30
  for (auto [key, value] : {std::pair{"DefaultDataclassSyncIntervalSeconds", 119},
                            std::pair{"MinAutomaticallySyncInterval", 1}})
    PreferenceStore::shared().setValue(key, Value(value), kVantorDefaultsKey, Scope::AnyHost);
  prefs.resetConfigurationForTesting();
  EXPECT_EQ(prefs.automaticallySyncInterval(), 1);

  EXPECT_FALSE(nextAutoSyncTriggerDate());  // off
  turnOn(1, 1);
  prefs.setLastSyncDate(time.now() - std::chrono::seconds(10));
  EXPECT_FALSE(nextAutoSyncTriggerDate());  // no StartInterval: the last sync, passed
  Value withInterval = job();
  withInterval.mutableDictionary().set("StartInterval", Value(3600));
  vtc::plist::writeFileAtomically(vtc::autosync::periodicJobFile(), withInterval);
  EXPECT_EQ(nextAutoSyncTriggerDate(), time.now() + std::chrono::seconds(3590));
}

}  // namespace
