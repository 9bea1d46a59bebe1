// Whether the sync client runs or syncs, read from the owner file and the
// engine's sync plans; this library's client record.
#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <fstream>

#include "VantorSyncManager/PublicNames.h"
#include "VantorSyncManager/SyncStatus.h"
#include "VantorSyncManager/VTCPrefsCenter.h"
#include "platform/engine/SyncEngine.h"
#include "support/TestHome.h"

namespace {

class SyncStatus : public ::testing::Test {
 protected:
  vtc::test::TestHome home;
  void writeOwner(const std::string& text) {
    std::ofstream(*VTCPrefsCenter::applicationSupportDirectory() + "/.owner.pid") << text;
  }
};

TEST_F(SyncStatus, TheOwnerFileNamesALiveProcessOrNothing) {
  EXPECT_FALSE(NubiloIsRunning());  // no file
  for (const char* nonsense : {"0", "-4", "twelve", ""}) {
    writeOwner(nonsense);
    EXPECT_FALSE(NubiloIsRunning()) << nonsense;
  }
  writeOwner(std::to_string(::getpid()));
  EXPECT_TRUE(NubiloIsRunning());
  writeOwner("1");  // alive, and another user's unless the tests run as root
  EXPECT_TRUE(NubiloIsRunning());
  pid_t ended = ::fork();
  if (ended == 0) ::_exit(0);
  ::waitpid(ended, nullptr, 0);
  writeOwner(std::to_string(ended));
  EXPECT_FALSE(NubiloIsRunning());
}

TEST_F(SyncStatus, OnlyARunningPlanWithThisClientCountsAsSyncing) {
  auto engine = vtc::engine::SyncEngine::open();
  int64_t other = engine->beginSyncPlan({"app.contacts"});
  engine->setSyncPlanStatus(other, 7);
  int64_t waiting = engine->beginSyncPlan({kVantorSyncClientId});
  engine->setSyncPlanStatus(waiting, 3);
  EXPECT_FALSE(NubiloCurrentlySyncing());
  writeOwner(std::to_string(::getpid()));  // the answer falls back to the owner file
  EXPECT_TRUE(NubiloCurrentlySyncing());
  writeOwner("");
  engine->setSyncPlanStatus(waiting, 1);
  EXPECT_TRUE(NubiloCurrentlySyncing());
}

TEST_F(SyncStatus, TheClientRecordIsRegisteredWithTheInstalledDescription) {
  auto client = getVantorClient();
  ASSERT_TRUE(client);
  EXPECT_EQ(client->clientIdentifier(), kVantorSyncClientId);
  EXPECT_TRUE(client->description().get("Dataclasses").dictionary().contains("com.korvo.Contacts"));
  client->setObject(vtc::Value("x"), "probe");
  EXPECT_EQ(getNubiloClient()->objectForKey("probe"), vtc::Value("x"));
  EXPECT_EQ(getVanterConfiguration().get("sync_namespace"),
            VTCPrefsCenter::defaultCenter().configuration().get("sync_namespace"));
}

}  // namespace
