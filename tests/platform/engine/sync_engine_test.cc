// The embedded sync engine: two local clients and the network client
// exchanging changes, conflicts, resets, bad input, and two processes
// pushing at once.
#include <gmock/gmock.h>

#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <sstream>

#include "common/Logging.h"
#include "platform/engine/SyncEngine.h"
#include "platform/prefs/PreferenceStore.h"
#include "support/FakeTime.h"
#include "support/TestHome.h"

using vtc::Array;
using vtc::Dictionary;
using vtc::Value;
using vtc::engine::SyncEngine;
using Changes = std::vector<SyncEngineChange>;
using ::testing::HasSubstr;

namespace {

Value set(const std::string& name, Value v) {
  return Value(Dictionary{{"action", "set"}, {"name", name}, {"value", std::move(v)}});
}
Value clear(const std::string& name) {
  return Value(Dictionary{{"action", "clear"}, {"name", name}});
}
// A modify of record r1 setting its name.
Changes renamed(const std::string& name) {
  return {SyncEngineChange(2, "r1", Array{set("name", Value(name))})};
}

class Engine : public ::testing::Test {
 protected:
  vtc::test::TestHome home;
  vtc::test::FakeTime time;
  std::string path = home.path() + "/engine.sqlite";
  std::unique_ptr<SyncEngine> engine = SyncEngine::open(path);

  void push(const std::string& client, Changes changes) {
    engine->push(client, "Contacts", std::move(changes));
  }
  // Pulls and acknowledges, as a client does after applying the changes.
  Changes sync(const std::string& client) {
    auto r = engine->pull(client, "Contacts");
    engine->acknowledge(client, "Contacts", r.anchor);
    return r.changes;
  }
};

TEST_F(Engine, ClientsExchangeCoalescedChangesButNeverTheirOwn) {
  SyncEngineChange ann(1, "r1", Array{set("name", Value("Ann")), set("age", Value(30))});
  push("app.a", {ann});
  EXPECT_TRUE(sync("app.a").empty());  // its own change
  EXPECT_EQ(sync("app.b"), Changes{ann});

  // Two edits by A arrive at B as one change, the later value winning.
  push("app.a", renamed("Anna"));
  SyncEngineChange annie(2, "r1", Array{set("name", Value("Annie")), clear("age")});
  push("app.a", {annie});
  EXPECT_EQ(sync("app.b"), Changes{annie});

  // The network client, never synced, gets the record as it is now.
  EXPECT_EQ(sync("net"), Changes{SyncEngineChange(1, "r1", Array{set("name", Value("Annie"))})});

  // What the network client brings in reaches both local clients.
  SyncEngineChange gone(3, "r1", Array{});
  push("net", {gone});
  EXPECT_EQ(sync("app.a"), Changes{gone});
  EXPECT_EQ(sync("app.b"), Changes{gone});
  // A record added and deleted between two pulls never shows.
  push("app.a", {SyncEngineChange(1, "tmp", Array{set("x", Value(1))})});
  push("app.a", {SyncEngineChange(3, "tmp", Array{})});
  EXPECT_TRUE(sync("app.b").empty());
}

TEST_F(Engine, ConflictingEditsAreSettledByPushTimeThenClientAndLogged) {
  vtc::prefs::PreferenceStore::shared().setValue(
      "LoggingLevel", Value("info"), "com.korvo.VantorSync", vtc::prefs::Scope::AnyHost);
  push("app.a", {SyncEngineChange(1, "r1", Array{set("name", Value("Ann"))})});
  for (auto client : {"app.b", "net"}) sync(client);
  // B and the network client both change the name before pulling again.
  time.advance(vtc::Seconds(1));
  push("app.b", renamed("Bee"));
  time.advance(vtc::Seconds(1));
  push("net", renamed("Net"));
  EXPECT_EQ(sync("app.a"), renamed("Net"));

  // Same push time: the greater client identifier wins, whichever pushes last.
  for (auto client : {"app.b", "net"}) sync(client);
  time.advance(vtc::Seconds(1));
  push("app.b", renamed("B2"));
  push("app.a", renamed("A2"));
  EXPECT_EQ(sync("net"), renamed("B2"));

  std::stringstream log;
  log << std::ifstream(vtc::log::logFilePath()).rdbuf();
  EXPECT_THAT(log.str(), HasSubstr("Conflict on name of record r1 in Contacts: kept Net from net, "
                                   "dropped Bee from app.b"));
}

TEST_F(Engine, ResetsBadInputAndOddChanges) {
  // A reset client gets the whole truth as adds, once.
  push("app.a", {SyncEngineChange(1, "r1", Array{set("n", Value(1))}),
                 SyncEngineChange(1, "r2", Array{set("n", Value(2))})});
  sync("net");
  push("app.a", {SyncEngineChange(2, "r2", Array{set("n", Value(3))})});
  engine->resetClient("net", "Contacts");
  auto truth = sync("net");
  ASSERT_EQ(truth.size(), 2u);
  for (const auto& c : truth) EXPECT_EQ(c.type(), 1u);
  EXPECT_TRUE(sync("net").empty());

  // Bad input is refused whole.
  sync("app.b");
  EXPECT_THROW(push("app.a", {SyncEngineChange(1, "good", Array{set("n", Value(1))}),
                              SyncEngineChange(1, "bad", Array{set("n", Value())})}),
               std::invalid_argument);
  EXPECT_TRUE(sync("app.b").empty());
  push("app.a", {SyncEngineChange(2, "unknown", Array{set("n", Value(1))}),  // becomes an add
                 SyncEngineChange(3, "never-seen", Array{})});               // ignored
  EXPECT_EQ(sync("app.b"), Changes{SyncEngineChange(1, "unknown", Array{set("n", Value(1))})});
}

TEST_F(Engine, SyncPlansAreSharedBetweenConnections) {
  int64_t plan = engine->beginSyncPlan({"com.korvo.VantorSync", "app.a"});
  engine->setSyncPlanStatus(plan, 7);
  auto plans = SyncEngine::open(path)->currentSyncPlans();
  ASSERT_EQ(plans.size(), 1u);
  EXPECT_EQ(plans[0].status, 7);
  EXPECT_EQ(plans[0].participants[0], "com.korvo.VantorSync");
  engine->endSyncPlan(plan);
  EXPECT_TRUE(engine->currentSyncPlans().empty());
  EXPECT_THROW(engine->objectForKey("nobody", "x"), vtc::engine::EngineError);
}

TEST_F(Engine, TwoProcessesPushingAtOnceLoseNothing) {
  std::vector<pid_t> writers;
  for (std::string client : {"app.a", "app.b"}) {
    pid_t pid = ::fork();
    if (pid == 0) {
      auto own = SyncEngine::open(path);  // a connection of its own
      for (int i = 0; i < 100; ++i)
        own->push(client, "Contacts",
                  {SyncEngineChange(1, client + std::to_string(i), Array{set("i", Value(i))})});
      ::_exit(0);
    }
    writers.push_back(pid);
  }
  for (pid_t pid : writers) {
    int status = 0;
    ::waitpid(pid, &status, 0);
    ASSERT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
  }
  EXPECT_EQ(sync("net").size(), 200u);
}

TEST_F(Engine, ADamagedDatabaseIsReportedAndLeftInPlace) {
  std::string broken = home.path() + "/broken.sqlite";
  std::ofstream(broken) << std::string(8192, 'x');
  EXPECT_THAT([&] { SyncEngine::open(broken); },
              ::testing::ThrowsMessage<vtc::engine::EngineError>(HasSubstr("left in place")));
  EXPECT_EQ(std::filesystem::file_size(broken), 8192u);
}

}  // namespace
