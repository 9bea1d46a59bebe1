// The client as people live with it, through its commands and their output:
// status (and its JSON) before the first sync, after a good and a failed
// one and with a conflict pending; a conflict restored here taking effect
// on the other computer; the sentence and exit status of each failure.
#include <gmock/gmock.h>
#include <nlohmann/json.hpp>

#include <filesystem>

#include "localshare/ApacheShare.h"
#include "localshare/Computer.h"
#include "localshare/Processes.h"
#include "support/SessionBus.h"
#include "support/TestHome.h"

using testing::HasSubstr;
using testing::Not;
using vtc::local::ApacheShare;
using vtc::local::Computer;

namespace {

std::string card(const std::string& uid, const std::string& fn, const std::string& tel) {
  return "BEGIN:VCARD\r\nVERSION:3.0\r\nUID:" + uid + "\r\nFN:" + fn + "\r\nTEL:" + tel +
         "\r\nEND:VCARD\r\n";
}

class Living : public ::testing::Test {
 protected:
  vtc::test::TestHome home;
  ApacheShare share;
  std::string url = "http://127.0.0.1:" + std::to_string(share.port()) + "/sync";
  Computer a{"Mac A"};
  Computer b{"Mac B"};

  void SetUp() override {
    a.join(url, ApacheShare::kUser, ApacheShare::kPassword);
    b.join(url, ApacheShare::kUser, ApacheShare::kPassword);
  }
  nlohmann::json status(const Computer& c) {
    Computer::Result r = c.run({"status", "--json"});
    return nlohmann::json::parse(r.out);
  }
  const nlohmann::json& contacts(const nlohmann::json& s) { return s["dataclasses"][0]; }
};

TEST_F(Living, StatusBeforeAfterAGoodAndAFailedSyncAndWithAConflict) {
  // Before the first sync: the folders, nothing on the share yet.
  Computer::Result text = a.run({"status"});
  EXPECT_EQ(text.status, 0) << text.err;
  EXPECT_THAT(text.out, HasSubstr("This computer: Mac A"));
  EXPECT_THAT(text.out, HasSubstr("com.korvo.Contacts (contacts): " + a.contacts()));
  EXPECT_THAT(text.out, HasSubstr("last sync never"));
  nlohmann::json s = status(a);
  EXPECT_EQ(contacts(s)["lastSuccess"], nullptr);
  EXPECT_EQ(contacts(s)["share"]["maxversion"], nullptr);
  EXPECT_EQ(s["computers"].size(), 2u);

  // After a good sync: counts, dates, the share's versions and the report.
  Computer::write(a.contacts() + "/ann.vcf", card("ann", "Ann", "1"));
  Computer::write(a.contacts() + "/bob.vcf", card("bob", "Bob", "2"));
  ASSERT_EQ(a.run({"sync"}).status, 0);
  s = status(a);
  EXPECT_EQ(contacts(s)["items"], 2);
  EXPECT_NE(contacts(s)["lastSuccess"], nullptr);
  EXPECT_EQ(contacts(s)["share"]["maxversion"], 1);
  EXPECT_EQ(contacts(s)["failedCount"], 0);
  for (const auto& computer : s["computers"]) {
    if (computer["name"] != "Mac A") continue;
    EXPECT_TRUE(computer["thisComputer"].get<bool>());
    EXPECT_NE(computer["lastSync"], nullptr);
    EXPECT_EQ(computer["lastReport"]["com.korvo.Contacts:code"], "0");
    EXPECT_EQ(computer["lastReport"]["SyncStatus:syncType"], "manual");
  }
  EXPECT_THAT(b.run({"status"}).out, HasSubstr("Mac A: last sync 20"));

  // After a failed sync: the count and the sentence, here and in B's view of A.
  std::filesystem::remove_all(a.contacts());
  EXPECT_EQ(a.run({"sync"}).status, 1);
  s = status(a);
  EXPECT_EQ(contacts(s)["failedCount"], 1);
  EXPECT_THAT(contacts(s)["lastError"].get<std::string>(), HasSubstr("is missing"));
  EXPECT_THAT(a.run({"status"}).out, HasSubstr("1 failed sync since: The folder"));
  std::filesystem::create_directories(a.contacts());
  Computer::write(a.contacts() + "/ann.vcf", card("ann", "Ann", "1"));
  Computer::write(a.contacts() + "/bob.vcf", card("bob", "Bob", "2"));

  // With a conflict pending: listed in both forms.
  ASSERT_EQ(b.run({"sync"}).status, 0);
  Computer::write(a.contacts() + "/ann.vcf", card("ann", "Ann", "100"));
  Computer::write(b.contacts() + "/ann.vcf", card("ann", "Ann", "200"));
  ASSERT_EQ(a.run({"sync"}).status, 0);
  ASSERT_EQ(b.run({"sync"}).status, 0);
  EXPECT_THAT(b.run({"status"}).out, HasSubstr("1 conflict kept"));
  s = status(b);
  ASSERT_EQ(s["conflicts"].size(), 1u);
  EXPECT_EQ(s["conflicts"][0]["field"], "TEL");
  EXPECT_EQ(s["conflicts"][0]["lost"], "TEL:200\r\n");
  EXPECT_EQ(s["conflicts"][0]["keptComputer"], "Mac A");
}

TEST_F(Living, ARestoredConflictTakesEffectOnTheOtherComputerAndADroppedOneIsGone) {
  Computer::write(a.contacts() + "/ann.vcf", card("ann", "Ann", "1"));
  ASSERT_EQ(a.run({"sync"}).status, 0);
  ASSERT_EQ(b.run({"sync"}).status, 0);
  Computer::write(a.contacts() + "/ann.vcf", card("ann", "Ann A", "100"));
  Computer::write(b.contacts() + "/ann.vcf", card("ann", "Ann B", "200"));
  ASSERT_EQ(a.run({"sync"}).status, 0);
  ASSERT_EQ(b.run({"sync"}).status, 0);
  auto conflicts = status(b)["conflicts"];
  ASSERT_EQ(conflicts.size(), 2u);
  std::string tel, fn;
  for (const auto& c : conflicts) (c["field"] == "TEL" ? tel : fn) = c["id"].get<std::string>();

  Computer::Result restored = b.run({"conflicts", "restore", tel});
  EXPECT_EQ(restored.status, 0) << restored.err;
  EXPECT_THAT(restored.out, HasSubstr("Restored TEL of ann.vcf"));
  EXPECT_EQ(b.run({"conflicts", "drop", fn}).status, 0);
  EXPECT_THAT(b.run({"conflicts"}).out, HasSubstr("No conflicts"));
  EXPECT_EQ(b.run({"conflicts", "drop", fn}).status, 2);

  ASSERT_EQ(b.run({"sync"}).status, 0);
  ASSERT_EQ(a.run({"sync"}).status, 0);
  EXPECT_EQ(Computer::read(a.contacts() + "/ann.vcf"), card("ann", "Ann A", "200"));
  EXPECT_EQ(Computer::files(a.contacts()), Computer::files(b.contacts()));
}

TEST_F(Living, EachFailureIsOnePlainSentenceWithAnExitStatusOfItsKind) {
  // A refused login says to check the password, once.
  Computer wrong{"Mac W"};
  Computer::Result login = wrong.run({"setup", url, "--user", ApacheShare::kUser,
                                      "--password-command", "printf nope", "--allow-insecure"});
  EXPECT_EQ(login.status, 3);
  EXPECT_THAT(login.err, HasSubstr("refused the password for alice; check the member name and "
                                   "the password"));
  const size_t requests = share.accessEntries().size();
  a.setPreference("PasswordCommand", vtc::Value("printf nope"));  // a password changed elsewhere
  EXPECT_EQ(a.run({"sync"}).status, 3);
  EXPECT_LE(share.accessEntries().size() - requests, 2u);  // no retrying in a loop

  // An unreachable server names its address.
  Computer away{"Mac U"};
  const int closed = vtc::local::freeLoopbackPort();
  Computer::Result unreachable =
      away.run({"setup", "http://127.0.0.1:" + std::to_string(closed), "--user", "alice",
                "--password-command", "printf x", "--allow-insecure"});
  EXPECT_EQ(unreachable.status, 4);
  EXPECT_THAT(unreachable.err,
              HasSubstr("Cannot reach the server at http://127.0.0.1:" + std::to_string(closed)));

  // Bad input on the command line.
  EXPECT_EQ(b.run({"add", "addresses", b.home() + "/x"}).status, 2);
  Computer::Result second = b.run({"add", "contacts", b.home() + "/work"});
  EXPECT_EQ(second.status, 2);
  EXPECT_THAT(second.err, HasSubstr("give this folder a name of its own with --dataclass NAME"));
  EXPECT_EQ(b.run({"add", "contacts", b.home() + "/work", "--dataclass", "work.Contacts"}).status,
            0);
  EXPECT_EQ(b.run({"setup", "ftp://host", "--user", "x"}).status, 2);
  // A dataclass name that could reach outside the sync area is refused
  // before anything is made; one put into the preferences by hand is
  // ignored, and the sync goes on without it.
  Computer::Result evil =
      b.run({"add", "contacts", b.home() + "/evil", "--dataclass", "../../evil"});
  EXPECT_EQ(evil.status, 2);
  EXPECT_THAT(evil.err, HasSubstr("A dataclass name is a plain name of letters, digits, '.', '_' "
                                  "and '-', not starting with '.' and at most 100 long; this one "
                                  "is not: it starts with '.'."));
  EXPECT_THAT(b.run({"add", "contacts", b.home() + "/evil", "--dataclass", "a/b"}).err,
              HasSubstr("it contains the character '/'"));
  Computer::write(b.home() + "/evil/e.vcf", card("e", "Eve", "6"));
  b.setPreference(
      "SyncCollections",
      vtc::Value(vtc::Dictionary{
          {"com.korvo.Contacts", vtc::Dictionary{{"Kind", "contacts"}, {"Folder", b.contacts()}}},
          {"../../evil", vtc::Dictionary{{"Kind", "contacts"}, {"Folder", b.home() + "/evil"}}}}));
  Computer::Result synced = b.run({"sync", "-v"});
  EXPECT_EQ(synced.status, 0) << synced.err;
  EXPECT_THAT(synced.out, testing::Not(HasSubstr("evil")));
  for (const std::string& root : {share.documentRoot(), home.path()})
    for (const auto& entry : std::filesystem::recursive_directory_iterator(root))
      EXPECT_EQ(entry.path().filename().string().find("evil"),
                entry.path().string() == b.home() + "/evil" ? 0 : std::string::npos)
          << entry.path();
  Computer fresh{"Mac F"};
  Computer::Result notSetUp = fresh.run({"sync"});
  EXPECT_EQ(notSetUp.status, 2);
  EXPECT_THAT(notSetUp.err, HasSubstr("run `nubilosyncclient setup URL --user NAME`"));
}

TEST_F(Living, APasswordFromStandardInputGoesToTheSecretServiceAndNowhereElse) {
  vtc::test::SessionBus bus;
  bus.startKeyring();
  Computer c{"Mac S"};
  Computer::Result r =
      c.run({"setup", url, "--user", ApacheShare::kUser, "--password-stdin", "--allow-insecure"},
            std::string(ApacheShare::kPassword) + "\n");
  ASSERT_EQ(r.status, 0) << r.err;
  ASSERT_EQ(c.run({"add", "contacts", c.contacts()}).status, 0);
  Computer::write(c.contacts() + "/ann.vcf", card("ann", "Ann", "1"));
  Computer::Result synced = c.run({"sync"});
  EXPECT_EQ(synced.status, 0) << synced.err;
  // Not in any file the client wrote: preferences, log, statistics, engine.
  for (const auto& entry : std::filesystem::recursive_directory_iterator(c.home())) {
    if (!entry.is_regular_file() || entry.path().filename() == ".last-in") continue;
    EXPECT_EQ(Computer::read(entry.path().string()).find(ApacheShare::kPassword), std::string::npos)
        << entry.path();
  }
  // Nor on the share: records, changelogs, reports.
  for (const auto& entry : std::filesystem::recursive_directory_iterator(share.documentRoot())) {
    if (!entry.is_regular_file()) continue;
    EXPECT_EQ(Computer::read(entry.path().string()).find(ApacheShare::kPassword), std::string::npos)
        << entry.path();
  }
  EXPECT_THAT(c.run({"status", "--json"}).out, testing::Not(HasSubstr(ApacheShare::kPassword)));
}

}  // namespace

namespace {

TEST_F(Living, VersionSettingsAndForgettingAComputerThatIsGone) {
  Computer::Result version = a.run({"--version"});
  EXPECT_EQ(version.status, 0);
  EXPECT_THAT(version.out, testing::MatchesRegex("nubilosyncclient [0-9]+\\.[0-9]+\n"));

  // This computer's name and the log's level, without a property list.
  EXPECT_EQ(a.run({"config", "get", "name"}).out, "Mac A\n");
  EXPECT_EQ(a.run({"config", "set", "name", "Ann's laptop"}).status, 0);
  Computer::Result level = a.run({"config", "set", "log-level", "info"});
  EXPECT_EQ(level.status, 0) << level.err;
  EXPECT_EQ(level.out,
            "The log (~/Library/Logs/Sync/nubilosync.log) now records what each sync does, "
            "warnings and errors.\n");
  EXPECT_EQ(a.run({"config"}).out, "name Ann's laptop\nlog-level info\n");
  EXPECT_EQ(a.run({"config", "set", "colour", "red"}).status, 2);
  EXPECT_EQ(a.run({"config", "set", "log-level", "loud"}).status, 2);
  ASSERT_EQ(a.run({"sync"}).status, 0);
  EXPECT_THAT(Computer::read(a.home() + "/Library/Logs/Sync/nubilosync.log"), HasSubstr("|Info|"));
  EXPECT_THAT(a.run({"status"}).out,
              HasSubstr("Log: ~/Library/Logs/Sync/nubilosync.log (info; raise it with"));
  EXPECT_THAT(b.run({"status"}).out, HasSubstr("Ann's laptop: last sync 20"));

  // A computer seen lately is kept unless forced; a forgotten one is gone.
  Computer c{"Old desktop"};
  c.join(url, ApacheShare::kUser, ApacheShare::kPassword);
  ASSERT_EQ(c.run({"sync"}).status, 0);
  Computer::Result refused = b.run({"forget", "Old desktop"});
  EXPECT_EQ(refused.status, 2);
  EXPECT_THAT(refused.err, HasSubstr("within the last week; if it is gone for good, forget it "
                                     "with `nubilosyncclient forget --force Old desktop`"));
  EXPECT_EQ(b.run({"forget", "Nobody"}).status, 2);
  Computer::Result forgot = b.run({"forget", "--force", "Old desktop"});
  EXPECT_EQ(forgot.status, 0) << forgot.err;
  EXPECT_EQ(forgot.out, "Forgot Old desktop; if it syncs again, it joins as a new computer.\n");
  EXPECT_THAT(b.run({"status"}).out, Not(HasSubstr("Old desktop")));
  EXPECT_EQ(status(b)["computers"].size(), 2u);
}

}  // namespace

namespace {

TEST_F(Living, ConflictsAreListedByNameWithBothValuesOnEveryComputerAndDroppedAllAtOnce) {
  Computer::write(a.contacts() + "/ann.vcf", card("ann", "Ann Smith", "1"));
  ASSERT_EQ(a.run({"sync"}).status, 0);
  ASSERT_EQ(b.run({"sync"}).status, 0);
  Computer::write(a.contacts() + "/ann.vcf", card("ann", "Ann Smith", "100"));
  Computer::write(b.contacts() + "/ann.vcf", card("ann", "Ann Smith", "200"));
  ASSERT_EQ(a.run({"sync"}).status, 0);
  ASSERT_EQ(b.run({"sync"}).status, 0);
  ASSERT_EQ(a.run({"sync"}).status, 0);

  // Where the losing value is kept: by name, both values side by side.
  Computer::Result here = b.runOnTerminal({"conflicts"});
  EXPECT_EQ(here.status, 0) << here.out;
  EXPECT_THAT(here.out,
              testing::ContainsRegex(
                  "[0-9a-f]{8}  Ann Smith: TEL  \\(ann\\.vcf, com\\.korvo\\.Contacts\\)"));
  EXPECT_THAT(here.out, testing::ContainsRegex("kept \\(from Mac A\\) +\\| lost \\(from Mac B, "
                                               "20[0-9-]{8} [0-9:]{8}\\)"));
  EXPECT_THAT(here.out, testing::ContainsRegex("TEL:100 +\\| TEL:200"));
  // On the other computer: the same conflict, named as kept on Mac B.
  Computer::Result there = a.run({"conflicts"});
  EXPECT_EQ(there.status, 0) << there.err;
  EXPECT_THAT(there.out, HasSubstr("No conflicts are kept here.\n\nKept on Mac B (restore or drop "
                                   "them there):\n  Ann Smith: TEL  (ann.vcf, "
                                   "com.korvo.Contacts)\n"));
  EXPECT_THAT(there.out, testing::ContainsRegex("TEL:100 +\\| TEL:200"));

  Computer::Result dropped = b.run({"conflicts", "drop", "--all"});
  EXPECT_EQ(dropped.out, "Dropped 1 conflict; the values that stand are unchanged.\n");
  EXPECT_EQ(b.run({"conflicts", "drop"}).status, 2);
  ASSERT_EQ(b.run({"sync"}).status, 0);
  EXPECT_EQ(a.run({"conflicts"}).out, "No conflicts are kept here.\n");
}

}  // namespace

namespace {

TEST_F(Living, AFolderNameAndColourTravelWithTheCollectionAndATildeMeansTheHome) {
  Computer::write(a.contacts() + "/displayname", "Family\n");
  Computer::write(a.contacts() + "/color", "#ff8800\n");
  Computer::write(a.contacts() + "/ann.vcf", card("ann", "Ann", "1"));
  ASSERT_EQ(a.run({"sync"}).status, 0);
  ASSERT_EQ(b.run({"sync"}).status, 0);
  EXPECT_EQ(Computer::read(b.contacts() + "/displayname"), "Family\n");
  EXPECT_EQ(Computer::read(b.contacts() + "/color"), "#ff8800\n");
  EXPECT_EQ(contacts(status(b))["items"], 1);  // properties, not records

  // A change on either side travels; a colour removed is removed.
  Computer::write(b.contacts() + "/displayname", "Family and friends\n");
  std::filesystem::remove(b.contacts() + "/color");
  ASSERT_EQ(b.run({"sync"}).status, 0);
  ASSERT_EQ(a.run({"sync"}).status, 0);
  EXPECT_EQ(Computer::read(a.contacts() + "/displayname"), "Family and friends\n");
  EXPECT_FALSE(std::filesystem::exists(a.contacts() + "/color"));

  Computer::Result added = a.run({"add", "contacts", "~/work", "--dataclass", "work.Contacts"});
  EXPECT_EQ(added.status, 0) << added.err;
  EXPECT_THAT(added.out, HasSubstr(a.home() + "/work"));
  EXPECT_TRUE(std::filesystem::is_directory(a.home() + "/work"));
}

}  // namespace
