// Whether the sync client runs or syncs, read from the owner file and the
// engine's sync plans; this library's client record.
#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
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
  // A process of another user: the null signal is refused (EPERM), and the
  // process is alive all the same. Asked from a child that is another user
  // when the tests run as root.
  pid_t asker = ::fork();
  if (asker == 0) {
    const pid_t owner = ::getuid() == 0 ? ::getppid() : 1;
    if (::getuid() == 0 && (::setgid(65534) != 0 || ::setuid(65534) != 0)) ::_exit(2);
    const bool refused = ::kill(owner, 0) != 0 && errno == EPERM;
    ::_exit(refused && isProcessRunning(owner) ? 0 : 1);
  }
  int status = -1;
  ::waitpid(asker, &status, 0);
  EXPECT_EQ(status, 0);
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

}  // namespace
