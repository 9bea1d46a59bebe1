// The embedded sync engine: two local clients and the network client
// exchanging changes, conflicts, resets, bad input, and two processes
// pushing at once.
#include <gmock/gmock.h>

#include <sqlite3.h>
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

// Pulls carry the values that stand now: a client is never sent back its own
// winning value, and the loser of a conflict gets the winner's.
TEST_F(Engine, PullsCarryCurrentValuesAndConflictsAreToldWithTheirComputers) {
  push("vdir", {SyncEngineChange(1, "r1", Array{set("FN", Value("Ann")), set("TEL", Value("1"))})});
  sync("vdir");
  sync("net");
  std::vector<vtc::engine::Conflict> conflicts;
  vtc::engine::PushOptions fromMacB{"Mac B", [&](const auto& c) { conflicts.push_back(c); }, {}};
  // The folder edits FN and TEL; then the network brings FN from Mac B.
  push("vdir",
       {SyncEngineChange(2, "r1", Array{set("FN", Value("Local")), set("TEL", Value("2"))})});
  time.advance(vtc::Seconds(1));
  engine->push("net", "Contacts", {SyncEngineChange(2, "r1", Array{set("FN", Value("Remote"))})},
               fromMacB);
  ASSERT_EQ(conflicts.size(), 1u);
  EXPECT_EQ(conflicts[0].property, "FN");
  EXPECT_EQ(conflicts[0].kept, Value("Remote"));
  EXPECT_EQ(conflicts[0].lost, Value("Local"));
  EXPECT_EQ(conflicts[0].keptOrigin, "Mac B");
  EXPECT_EQ(conflicts[0].lostClient, "vdir");
  // The folder gets the winner; the network gets only TEL, not its own FN.
  EXPECT_EQ(sync("vdir"), Changes{SyncEngineChange(2, "r1", Array{set("FN", Value("Remote"))})});
  EXPECT_EQ(sync("net"), Changes{SyncEngineChange(2, "r1", Array{set("TEL", Value("2"))})});

  // A conflict handler that fails undoes the whole push.
  push("vdir", renamed("x"));
  time.advance(vtc::Seconds(1));
  vtc::engine::PushOptions failing{
      "Mac B", [](const auto&) { throw std::runtime_error("disk"); }, {}};
  EXPECT_THROW(engine->push("net", "Contacts",
                            {SyncEngineChange(2, "r1", Array{set("name", Value("y"))}),
                             SyncEngineChange(1, "r9", Array{set("n", Value(9))})},
                            failing),
               std::runtime_error);
  EXPECT_EQ(engine->recordCount("Contacts"), 1);

  // Deleted and added again by others: the client's copy is replaced whole.
  sync("vdir");
  push("net", {SyncEngineChange(3, "r1", Array{})});
  push("net", {SyncEngineChange(1, "r1", Array{set("FN", Value("New"))})});
  EXPECT_EQ(sync("vdir"), Changes{SyncEngineChange(1, "r1", Array{set("FN", Value("New"))})});
}

// An edit made elsewhere before a delete was seen: whichever reaches the
// engine later wins, and the other side is kept as a conflict.
TEST_F(Engine, ADeleteAndAnEditOfOneRecordSettleWholeAndKeepTheLoser) {
  push("vdir", {SyncEngineChange(1, "r1", Array{set("FN", Value("Ann")), set("TEL", Value("1"))})});
  sync("vdir");
  sync("net");
  std::vector<vtc::engine::Conflict> conflicts;
  vtc::engine::PushOptions told{"Mac B", [&](const auto& c) { conflicts.push_back(c); }, {}};
  // Deleted here, then another computer's edit of the phone arrives: the
  // record comes back whole, and the delete is the loser.
  engine->push("vdir", "Contacts", {SyncEngineChange(3, "r1", Array{})}, told);
  time.advance(vtc::Seconds(1));
  engine->push("net", "Contacts", {SyncEngineChange(2, "r1", Array{set("TEL", Value("2"))})}, told);
  ASSERT_EQ(conflicts.size(), 1u);
  EXPECT_EQ(conflicts[0].property, "(record)");
  EXPECT_EQ(conflicts[0].lost, Value("deleted"));
  EXPECT_EQ(sync("vdir"), Changes{SyncEngineChange(
                              1, "r1", Array{set("FN", Value("Ann")), set("TEL", Value("2"))})});
  EXPECT_TRUE(sync("net").empty());  // the delete is not sent: it lost

  // Edited here, then another computer's delete arrives: the delete wins and
  // the edit is kept.
  push("vdir", {SyncEngineChange(2, "r1", Array{set("FN", Value("Anna"))})});
  time.advance(vtc::Seconds(1));
  engine->push("net", "Contacts", {SyncEngineChange(3, "r1", Array{})}, told);
  ASSERT_EQ(conflicts.size(), 2u);
  EXPECT_EQ(conflicts[1].property, "FN");
  EXPECT_EQ(conflicts[1].lost, Value("Anna"));
  EXPECT_EQ(sync("vdir"), Changes{SyncEngineChange(3, "r1", Array{})});
  EXPECT_EQ(engine->recordCount("Contacts"), 0);

  // Deleted here and already sent; an edit made elsewhere before that
  // computer saw the delete still brings the record back whole, and the
  // delete here is noted as the loser. A delete that came from the network
  // itself, undone the same way, is no one's loss here.
  push("vdir", {SyncEngineChange(1, "r2", Array{set("FN", Value("Bo")), set("TEL", Value("3"))})});
  sync("net");
  push("vdir", {SyncEngineChange(3, "r2", Array{})});
  sync("net");
  sync("vdir");
  engine->push("net", "Contacts", {SyncEngineChange(2, "r2", Array{set("TEL", Value("4"))})}, told);
  ASSERT_EQ(conflicts.size(), 3u);
  EXPECT_EQ(conflicts[2].record, "r2");
  EXPECT_EQ(conflicts[2].lost, Value("deleted"));
  EXPECT_EQ(sync("vdir"), Changes{SyncEngineChange(
                              1, "r2", Array{set("FN", Value("Bo")), set("TEL", Value("4"))})});
  engine->push("net", "Contacts", {SyncEngineChange(3, "r2", Array{})}, told);
  engine->push("net", "Contacts", {SyncEngineChange(2, "r2", Array{set("TEL", Value("5"))})}, told);
  EXPECT_EQ(conflicts.size(), 3u);
  EXPECT_EQ(engine->recordCount("Contacts"), 1);
}

TEST_F(Engine, StatesTravelWithPushesAndAcknowledgementsAndADryRunForgetsEverything) {
  vtc::engine::StoredItem item{{400, 1, 2, 3, "a"}, Value("A")};
  vtc::engine::StateUpdate state{Value(Dictionary{{"index", 4}}), {{"a.vcf", item}}};
  engine->push("vdir", "Contacts", {SyncEngineChange(1, "a.vcf", Array{set("FN", Value("A"))})},
               {"", {}, state});
  EXPECT_EQ(engine->clientState("vdir", "Contacts"), Value(Dictionary{{"index", 4}}));
  EXPECT_EQ(engine->itemStamps("vdir", "Contacts").at("a.vcf"), item.stamp);
  EXPECT_EQ(engine->itemDetails("vdir", "Contacts", {"a.vcf", "b.vcf"}),
            (std::map<std::string, Value>{{"a.vcf", Value("A")}}));
  auto pulled = engine->pull("net", "Contacts");
  engine->acknowledge("net", "Contacts", pulled.anchor,
                      {std::nullopt, {{"a.vcf", std::nullopt}, {"b.vcf", item}}});
  EXPECT_EQ(engine->itemStamps("net", "Contacts").size(), 1u);
  EXPECT_TRUE(engine->pull("net", "Contacts").changes.empty());
  EXPECT_TRUE(engine->clientState("net", "Contacts").isNone());

  // A copy in memory: what is done to it never reaches the file.
  ::setenv("XDG_DATA_HOME", home.path().c_str(), 1);
  auto real = SyncEngine::open();
  real->push("vdir", "Contacts", {SyncEngineChange(1, "kept", Array{set("n", Value(1))})});
  auto copy = SyncEngine::openInMemoryCopy();
  EXPECT_EQ(copy->recordCount("Contacts"), 1);
  copy->push("vdir", "Contacts", {SyncEngineChange(1, "dry", Array{set("n", Value(2))})});
  EXPECT_EQ(copy->recordCount("Contacts"), 2);
  EXPECT_EQ(SyncEngine::open()->recordCount("Contacts"), 1);
  ::unsetenv("XDG_DATA_HOME");
}

// The sync client's truth: one transaction stores records, what a folder
// must take in and its item states; an item that holds its record's truth
// stores none of its own, and keeps the old truth when the truth changes.
TEST_F(Engine, ASyncStoresItsTruthWholeAndAnItemKeepsTheTruthItHeld) {
  vtc::engine::SyncOutcome first;
  first.networkClient = "net";
  first.folderClient = "vdir";
  first.truth = {{"ann", Dictionary{{"FN", "Ann"}}, "Mac A", false},
                 {"bob", Dictionary{{"FN", "Bob"}}, "Mac A", false}};
  first.folderTakes = {"bob"};
  first.folder.items = {{"ann.vcf", vtc::engine::StoredItem{{1, 2, 3, 4, "ann"}, Value()}}};
  engine->storeSync("Contacts", first);
  EXPECT_EQ(engine->folderTakes("vdir", "Contacts"), std::vector<std::string>{"bob"});
  EXPECT_EQ(engine->itemDetails("vdir", "Contacts", {"ann.vcf"}).at("ann.vcf"),
            Value(Dictionary{{"FN", "Ann"}}));

  vtc::engine::SyncOutcome second = first;
  second.truth = {{"ann", Dictionary{{"FN", "Ann Smith"}}, "Mac B", false},
                  {"bob", std::nullopt, "Mac B", false}};
  second.folderTakes = {"ann"};
  second.folder.items.clear();
  engine->storeSync("Contacts", second);
  // The file still holds the truth it was written with.
  EXPECT_EQ(engine->itemDetails("vdir", "Contacts", {"ann.vcf"}).at("ann.vcf"),
            Value(Dictionary{{"FN", "Ann"}}));
  EXPECT_EQ(engine->recordsWithIdentifiers("Contacts", {"ann", "bob"}).size(), 1u);
  const auto buried = engine->tombstones("Contacts", {"bob"});
  ASSERT_EQ(buried.count("bob"), 1u);
  EXPECT_EQ(buried.at("bob").origin, "Mac B");
  EXPECT_EQ(buried.at("bob").record, (Dictionary{{"FN", "Bob"}}));
  engine->storeFolderUpdate("vdir", "Contacts", {{"ann", "bob"}, {}, {}});
  EXPECT_TRUE(engine->folderTakes("vdir", "Contacts").empty());
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

TEST_F(Engine, ADamagedDatabaseIsReportedAndLeftInPlaceAndMissingMemoryIsNoDamage) {
  std::string broken = home.path() + "/broken.sqlite";
  std::ofstream(broken) << std::string(8192, 'x');
  EXPECT_THAT([&] { SyncEngine::open(broken); },
              ::testing::ThrowsMessage<vtc::engine::EngineError>(HasSubstr("left in place")));
  EXPECT_EQ(std::filesystem::file_size(broken), 8192u);

  sqlite3_hard_heap_limit64(1);  // every allocation of SQLite fails from here
  EXPECT_THROW(sync("app.a"), std::bad_alloc);
  sqlite3_hard_heap_limit64(0);
  EXPECT_TRUE(sync("app.a").empty());
}

}  // namespace
