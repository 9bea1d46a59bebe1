// The embedded sync engine: two local clients and the network client
// exchanging changes, conflicts, resets, bad input, and two processes
// pushing at once.
#include <gtest/gtest.h>

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

namespace {

Value set(const std::string& name, Value v) {
  return Value(Dictionary{{"action", "set"}, {"name", name}, {"value", std::move(v)}});
}
Value clear(const std::string& name) {
  return Value(Dictionary{{"action", "clear"}, {"name", name}});
}

class Engine : public ::testing::Test {
 protected:
  vtc::test::TestHome home;
  vtc::test::FakeTime time;
  std::string path = home.path() + "/engine.sqlite";
  std::unique_ptr<SyncEngine> engine = SyncEngine::open(path);

  // Pulls and acknowledges, as a client does after applying the changes.
  std::vector<SyncEngineChange> sync(const std::string& client) {
    auto r = engine->pull(client, "Contacts");
    engine->acknowledge(client, "Contacts", r.anchor);
    return r.changes;
  }
};

TEST_F(Engine, ClientsExchangeCoalescedChangesButNeverTheirOwn) {
  engine->push(
      "app.a", "Contacts",
      {SyncEngineChange(1, "r1", Array{set("name", Value("Ann")), set("age", Value(30))})});
  EXPECT_TRUE(sync("app.a").empty());  // its own change
  auto b = sync("app.b");
  ASSERT_EQ(b.size(), 1u);
  EXPECT_EQ(b[0],
            SyncEngineChange(1, "r1", Array{set("name", Value("Ann")), set("age", Value(30))}));

  // Two edits by A arrive at B as one change, the later value winning.
  engine->push("app.a", "Contacts", {SyncEngineChange(2, "r1", Array{set("name", Value("Anna"))})});
  engine->push("app.a", "Contacts",
               {SyncEngineChange(2, "r1", Array{set("name", Value("Annie")), clear("age")})});
  EXPECT_EQ(sync("app.b"), (std::vector<SyncEngineChange>{SyncEngineChange(
                               2, "r1", Array{set("name", Value("Annie")), clear("age")})}));

  // The network client, never synced, gets the record as it is now.
  EXPECT_EQ(sync("net"), (std::vector<SyncEngineChange>{
                             SyncEngineChange(1, "r1", Array{set("name", Value("Annie"))})}));

  // What the network client brings in reaches both local clients.
  engine->push("net", "Contacts", {SyncEngineChange(3, "r1", Array{})});
  EXPECT_EQ(sync("app.a"), (std::vector<SyncEngineChange>{SyncEngineChange(3, "r1", Array{})}));
  EXPECT_EQ(sync("app.b"), (std::vector<SyncEngineChange>{SyncEngineChange(3, "r1", Array{})}));
  // A record added and deleted between two pulls never shows.
  engine->push("app.a", "Contacts", {SyncEngineChange(1, "tmp", Array{set("x", Value(1))})});
  engine->push("app.a", "Contacts", {SyncEngineChange(3, "tmp", Array{})});
  EXPECT_TRUE(sync("app.b").empty());
}

TEST_F(Engine, ConflictingEditsAreSettledByPushTimeThenClientAndLogged) {
  vtc::prefs::PreferenceStore::shared().setValue(
      "LoggingLevel", Value("info"), "com.korvo.VantorSync", vtc::prefs::Scope::AnyHost);
  engine->push("app.a", "Contacts", {SyncEngineChange(1, "r1", Array{set("name", Value("Ann"))})});
  sync("app.b");
  sync("net");
  // B and the network client both change the name before pulling again.
  time.advance(vtc::Seconds(1));
  engine->push("app.b", "Contacts", {SyncEngineChange(2, "r1", Array{set("name", Value("Bee"))})});
  time.advance(vtc::Seconds(1));
  engine->push("net", "Contacts", {SyncEngineChange(2, "r1", Array{set("name", Value("Net"))})});
  EXPECT_EQ(engine->pull("app.a", "Contacts").changes[0].changes()[0], set("name", Value("Net")));

  // Same push time: the greater client identifier wins, whichever pushes last.
  sync("app.a");
  sync("app.b");
  sync("net");
  time.advance(vtc::Seconds(1));
  engine->push("app.b", "Contacts", {SyncEngineChange(2, "r1", Array{set("name", Value("B2"))})});
  engine->push("app.a", "Contacts", {SyncEngineChange(2, "r1", Array{set("name", Value("A2"))})});
  auto toNet = engine->pull("net", "Contacts").changes;
  ASSERT_EQ(toNet.size(), 1u);
  EXPECT_EQ(toNet[0].changes()[0], set("name", Value("B2")));

  std::ifstream log(vtc::log::logFilePath());
  std::stringstream text;
  text << log.rdbuf();
  EXPECT_NE(text.str().find("Conflict on name of record r1 in Contacts: kept Net from net, "
                            "dropped Bee from app.b"),
            std::string::npos)
      << text.str();
}

TEST_F(Engine, AResetClientGetsTheWholeTruthAsAdds) {
  engine->push("app.a", "Contacts",
               {SyncEngineChange(1, "r1", Array{set("n", Value(1))}),
                SyncEngineChange(1, "r2", Array{set("n", Value(2))})});
  sync("net");
  engine->push("app.a", "Contacts", {SyncEngineChange(2, "r2", Array{set("n", Value(3))})});
  engine->resetClient("net", "Contacts");
  auto truth = sync("net");
  ASSERT_EQ(truth.size(), 2u);
  for (const auto& c : truth) EXPECT_EQ(c.type(), 1u);
  EXPECT_TRUE(sync("net").empty());
}

TEST_F(Engine, BadInputIsRefusedWholeAndOddChangesAreMadeSense) {
  EXPECT_THROW(engine->push("app.a", "Contacts",
                            {SyncEngineChange(1, "good", Array{set("n", Value(1))}),
                             SyncEngineChange(1, "bad", Array{set("n", Value())})}),
               std::invalid_argument);
  EXPECT_TRUE(sync("app.b").empty());  // nothing of that push was applied
  engine->push("app.a", "Contacts",
               {SyncEngineChange(2, "unknown", Array{set("n", Value(1))}),  // becomes an add
                SyncEngineChange(3, "never-seen", Array{})});               // ignored
  EXPECT_EQ(
      sync("app.b"),
      (std::vector<SyncEngineChange>{SyncEngineChange(1, "unknown", Array{set("n", Value(1))})}));
}

TEST_F(Engine, ClientRecordsSchemasAndSyncPlans) {
  engine->registerClient("com.korvo.VantorSync", Dictionary{{"Type", "server"}});
  engine->setObjectForKey("com.korvo.VantorSync", "lastSuccessSync", Value(time.now()));
  EXPECT_EQ(engine->objectForKey("com.korvo.VantorSync", "lastSuccessSync").date(), time.now());
  engine->setShouldSynchronize("com.korvo.VantorSync", true, {"app", "peer"});
  EXPECT_TRUE(engine->objectForKey("com.korvo.VantorSync", "SynchronizeWithClientTypes")
                  .dictionary()
                  .get("peer")
                  .boolean());
  EXPECT_THROW(engine->objectForKey("nobody", "x"), vtc::engine::EngineError);

  Array versions{Value(Dictionary{{"Name", "Contacts"}, {"MajorVersion", 2}, {"MinorVersion", 1}})};
  engine->setSchemaVersions("Contacts", versions);
  EXPECT_EQ(SyncEngine::open(path)->schemaVersions("Contacts"), versions);

  int64_t plan = engine->beginSyncPlan({"com.korvo.VantorSync", "app.a"});
  engine->setSyncPlanStatus(plan, 7);
  auto plans = SyncEngine::open(path)->currentSyncPlans();  // seen by another connection
  ASSERT_EQ(plans.size(), 1u);
  EXPECT_EQ(plans[0].status, 7);
  EXPECT_EQ(plans[0].participants[0], "com.korvo.VantorSync");
  engine->endSyncPlan(plan);
  EXPECT_TRUE(engine->currentSyncPlans().empty());
}

TEST_F(Engine, TwoProcessesPushingAtOnceLoseNothing) {
  auto writer = [&](const std::string& client) {
    pid_t pid = ::fork();
    if (pid == 0) {
      auto own = SyncEngine::open(path);  // a connection of its own
      for (int i = 0; i < 100; ++i)
        own->push(client, "Contacts",
                  {SyncEngineChange(1, client + std::to_string(i), Array{set("i", Value(i))})});
      ::_exit(0);
    }
    return pid;
  };
  pid_t a = writer("app.a"), b = writer("app.b");
  int sa = 0, sb = 0;
  ::waitpid(a, &sa, 0);
  ::waitpid(b, &sb, 0);
  ASSERT_TRUE(WIFEXITED(sa) && WEXITSTATUS(sa) == 0);
  ASSERT_TRUE(WIFEXITED(sb) && WEXITSTATUS(sb) == 0);
  EXPECT_EQ(sync("net").size(), 200u);
}

TEST_F(Engine, ADamagedDatabaseIsReportedAndLeftInPlace) {
  std::string broken = home.path() + "/broken.sqlite";
  std::ofstream(broken) << std::string(8192, 'x');
  try {
    SyncEngine::open(broken);
    FAIL() << "opened";
  } catch (const vtc::engine::EngineError& e) {
    EXPECT_NE(std::string(e.what()).find("left in place"), std::string::npos) << e.what();
  }
  EXPECT_EQ(std::filesystem::file_size(broken), 8192u);
}

}  // namespace
