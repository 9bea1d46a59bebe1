// The preference store on disk: concurrent writers in two processes, other
// processes' writes seen after a synchronize, and corrupt files moved aside.
#include <gtest/gtest.h>

#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <sstream>

#include "common/Logging.h"
#include "platform/prefs/PreferenceFiles.h"
#include "platform/prefs/PreferenceStore.h"
#include "support/TestHome.h"

using vtc::prefs::PreferenceStore;
using vtc::prefs::Scope;

namespace {

constexpr const char* kDomain = "com.korvo.VantorSync";

std::string readText(const std::string& path) {
  std::stringstream s;
  s << std::ifstream(path).rdbuf();
  return s.str();
}

class PreferenceStoreTest : public ::testing::Test {
 protected:
  vtc::test::TestHome home;
  PreferenceStore& store = PreferenceStore::shared();

  // Starts body in a child process that reads the files afresh.
  template <typename F>
  static pid_t spawn(F body) {
    pid_t pid = ::fork();
    if (pid == 0) {
      PreferenceStore::shared().resetForTesting();
      body();
      ::_exit(0);
    }
    return pid;
  }
  // Waits for the child; true when it exited 0.
  static bool succeeded(pid_t pid) {
    int status = 0;
    return ::waitpid(pid, &status, 0) == pid && WIFEXITED(status) && WEXITSTATUS(status) == 0;
  }
};

TEST_F(PreferenceStoreTest, TwoProcessesWritingDifferentKeysLoseNothing) {
  auto writer = [](const std::string& prefix) {
    return [prefix] {
      auto& s = PreferenceStore::shared();
      for (int i = 0; i < 40; ++i) {
        s.setValue(prefix + std::to_string(i), vtc::Value(i), kDomain, Scope::CurrentHost);
        if (!s.synchronize(kDomain, Scope::CurrentHost)) ::_exit(1);
      }
    };
  };
  pid_t a = spawn(writer("a."));
  pid_t b = spawn(writer("b."));
  ASSERT_TRUE(succeeded(a));
  ASSERT_TRUE(succeeded(b));
  ASSERT_TRUE(store.synchronize(kDomain, Scope::CurrentHost));
  EXPECT_EQ(store.copyKeyList(kDomain, Scope::CurrentHost).size(), 80u);
  EXPECT_EQ(store.copyValue("b.39", kDomain, Scope::CurrentHost).integer(), 39);
}

TEST_F(PreferenceStoreTest, PendingRemovalsAndOtherProcessesWritesMeetOnDisk) {
  store.setMultiple(vtc::Dictionary{{"keep", 1}, {"drop", 2}}, {}, kDomain, Scope::AnyHost);
  ASSERT_TRUE(store.synchronize(kDomain, Scope::AnyHost));
  ASSERT_TRUE(succeeded(spawn([] {
    auto& s = PreferenceStore::shared();
    s.setValue("other", vtc::Value("from the child"), kDomain, Scope::AnyHost);
    s.synchronize(kDomain, Scope::AnyHost);
  })));
  // Not seen before a synchronize, seen after; our removal goes through.
  EXPECT_TRUE(store.copyValue("other", kDomain, Scope::AnyHost).isNone());
  store.setValue("drop", vtc::Value(), kDomain, Scope::AnyHost);
  EXPECT_TRUE(store.copyValue("drop", kDomain, Scope::AnyHost).isNone());
  ASSERT_TRUE(store.synchronize(kDomain, Scope::AnyHost));
  EXPECT_EQ(store.copyMultiple({}, kDomain, Scope::AnyHost),
            (vtc::Dictionary{{"keep", 1}, {"other", "from the child"}}));
  // Per-host values come first in the search list.
  store.setValue("keep", vtc::Value("host"), kDomain, Scope::CurrentHost);
  EXPECT_EQ(store.copyAppValue("keep", kDomain).string(), "host");
}

TEST_F(PreferenceStoreTest, ACorruptFileIsMovedAsideLoggedAndReadAsEmpty) {
  std::string path = vtc::prefs::perHostFile(kDomain);
  std::filesystem::create_directories(std::filesystem::path(path).parent_path());
  std::ofstream(path) << "<plist><dict><key>half";
  EXPECT_TRUE(store.copyValue("anything", kDomain, Scope::CurrentHost).isNone());
  EXPECT_FALSE(std::filesystem::exists(path));
  EXPECT_EQ(readText(path + ".corrupt"), "<plist><dict><key>half");
  std::string log = readText(vtc::log::logFilePath());
  EXPECT_NE(log.find("|Error|Preference file " + path + " is not a property list"),
            std::string::npos)
      << log;

  store.setValue("fresh", vtc::Value(true), kDomain, Scope::CurrentHost);
  ASSERT_TRUE(store.synchronize(kDomain, Scope::CurrentHost));
  EXPECT_TRUE(std::filesystem::exists(path + ".corrupt"));  // never overwritten
}

}  // namespace
