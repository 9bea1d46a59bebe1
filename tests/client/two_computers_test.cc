// Two and three computers of one account syncing their vdir folders through
// a real share: each computer a home of its own and nubilosyncclient a
// separate process, run as a person runs it.
#include <gmock/gmock.h>

#include <cstdio>
#include <filesystem>

#include "VantorSyncManager/NubiloRemoteSession.h"
#include "localshare/Computer.h"
#include "localshare/Share.h"
#include "support/ShareTest.h"
#include "support/TestHome.h"

using testing::HasSubstr;
using vtc::local::Computer;
using vtc::local::Share;
using vtc::local::ShareKind;

namespace {

std::string card(const std::string& uid, const std::string& fn, const std::string& email,
                 const std::string& tel) {
  return "BEGIN:VCARD\r\nVERSION:3.0\r\nUID:" + uid + "\r\nFN:" + fn + "\r\nN:" + fn +
         ";;;;\r\nEMAIL;TYPE=work:" + email + "\r\nTEL:" + tel + "\r\nEND:VCARD\r\n";
}

class TwoComputers : public ::testing::Test {
 protected:
  explicit TwoComputers(ShareKind kind = ShareKind::Apache)
      : server_(vtc::local::startShare(kind)) {}

  vtc::test::TestHome home;

 private:
  std::unique_ptr<Share> server_;

 protected:
  Share& share = *server_;
  std::string url = share.url("/sync");
  Computer a{"Mac A"};
  Computer b{"Mac B"};

  void SetUp() override {
    a.join(url, Share::kUser, Share::kPassword, share.setupArguments());
    b.join(url, Share::kUser, Share::kPassword, share.setupArguments());
  }
  // A library session on the account's sync area, as another program of
  // the account would open one.
  std::unique_ptr<NubiloRemoteSession> librarySession() const {
    vtc::Dictionary config = share.configuration();
    config.set("sync_path", vtc::Value("/sync"));
    if (!share.caFile().empty()) config.set("tls_ca_file", vtc::Value(share.caFile()));
    return NubiloRemoteSession::sessionWithUsername(Share::kUser, Share::kPassword, config);
  }
  // Syncs and expects success; the output for further checks.
  Computer::Result sync(const Computer& c, std::vector<std::string> more = {}) {
    std::vector<std::string> args{"sync", "-v"};  // a line per dataclass, as on a terminal
    args.insert(args.end(), more.begin(), more.end());
    Computer::Result r = c.run(args);
    EXPECT_EQ(r.status, 0) << c.name() << ": " << r.err << r.out;
    return r;
  }
  static std::map<std::string, std::string> contactsOf(const Computer& c) {
    return Computer::files(c.contacts());
  }
};

// The scenarios that meet the servers' differences (records, resets,
// repairs, entity tags) run on each; the rest on Apache. The life of an
// account runs as well on the servers as people run them: Apache as Debian
// ships it, set up by the guide's own site file, at the site's root and
// under its alias, and SabreDAV under a base path, as hosted storage is.
using Account = vtc::test::OnEachServer<TwoComputers>;
using AccountGuards = TwoComputers;
using ServersAsPeopleRunThem = vtc::test::OnEachServer<TwoComputers>;
INSTANTIATE_TEST_SUITE_P(Servers, Account, vtc::test::kEachServer, vtc::test::serverName);
INSTANTIATE_TEST_SUITE_P(Servers, ServersAsPeopleRunThem,
                         ::testing::Values(ShareKind::GuideApache, ShareKind::GuideApacheAlias,
                                           ShareKind::SabreUnderPath),
                         vtc::test::serverName);

TEST_P(ServersAsPeopleRunThem, SyncAConflictACompactionAndAResetAllWork) {
  const std::string dc = "com.korvo.Contacts";
  Computer::write(a.contacts() + "/ann.vcf", card("ann", "Ann", "ann@example.org", "1"));
  Computer::write(a.contacts() + "/bob.vcf", card("bob", "Bob", "bob@example.org", "2"));
  EXPECT_THAT(sync(a).out, HasSubstr("sent 2 changes"));
  EXPECT_THAT(sync(b).out, HasSubstr("received 2 changes"));

  // Both rename Bob: A's name reaches the share first and wins.
  Computer::write(a.contacts() + "/bob.vcf", card("bob", "Robert", "bob@example.org", "2"));
  Computer::write(b.contacts() + "/bob.vcf", card("bob", "Bobby", "bob@example.org", "2"));
  sync(a);
  EXPECT_THAT(sync(b).out, HasSubstr("kept 2 conflicts"));
  EXPECT_THAT(b.run({"conflicts"}).out, HasSubstr("FN:Bobby"));

  // A long history is compacted; B takes the new truth in.
  a.setPreference("compaction_max_changelogs", vtc::Value(2));
  bool compacted = false;
  for (int i = 0; i < 3 && !compacted; ++i) {
    Computer::write(a.contacts() + "/ann.vcf",
                    card("ann", "Ann", "ann@example.org", std::to_string(100 + i)));
    compacted = sync(a).out.find("history compacted") != std::string::npos;
  }
  EXPECT_TRUE(compacted);
  EXPECT_THAT(sync(b).out, HasSubstr("(slow sync)"));
  EXPECT_EQ(contactsOf(a), contactsOf(b));

  // Another program of the account resets the contacts: the collection goes
  // to the trash under the share's root, the first computer to sync writes
  // its truth again and the other takes it in.
  auto session = librarySession();
  session->lockDataclass(dc);
  session->resetDataclass(dc);
  session->unlockDataclass(dc);
  EXPECT_EQ(share.members("/Web/.Temporary Web Resources/SyncWorks/Trash").size(), 1u);
  EXPECT_THAT(sync(a).out, HasSubstr("sent 2 changes"));
  EXPECT_THAT(sync(b).out, HasSubstr("(slow sync)"));
  sync(a);
  EXPECT_EQ(contactsOf(a).size(), 2u);
  EXPECT_EQ(contactsOf(a)["bob.vcf"], card("bob", "Robert", "bob@example.org", "2"));
  EXPECT_EQ(contactsOf(a), contactsOf(b));
  // Collections are asked for as the server names them: beyond setup's
  // probes, which ask without the "/" on purpose, nothing met a redirect.
  for (const vtc::local::AccessEntry& e : share.accessEntries())
    EXPECT_TRUE(e.status / 100 != 3 || e.path.find(".probe") != std::string::npos)
        << e.method << " " << e.path << " " << e.status;
}

TEST_P(Account, AFirstSyncGoesBothWaysAndLeavesEqualFolders) {
  Computer::write(a.contacts() + "/ann.vcf", card("ann", "Ann", "ann@example.org", "1"));
  Computer::write(a.contacts() + "/bob.vcf", card("bob", "Bob", "bob@example.org", "2"));
  Computer::write(b.contacts() + "/cat.vcf", card("cat", "Cat", "cat@example.org", "3"));
  // The folder's name travels as a property of the collection, not a record.
  Computer::write(b.contacts() + "/displayname", "Friends");

  EXPECT_THAT(sync(a).out, HasSubstr("com.korvo.Contacts: sent 2 changes"));
  EXPECT_THAT(sync(b).out, HasSubstr("received 2 changes"));
  sync(a);
  auto aFiles = contactsOf(a), bFiles = contactsOf(b);
  EXPECT_EQ(aFiles["cat.vcf"], card("cat", "Cat", "cat@example.org", "3"));
  EXPECT_EQ(aFiles["displayname"], "Friends\n");
  aFiles.erase("displayname");
  bFiles.erase("displayname");
  EXPECT_EQ(aFiles.size(), 3u);
  EXPECT_EQ(aFiles, bFiles);
}

TEST_P(Account, EditsOfDifferentFieldsMergeDeletesTravelAndAConflictEndsTheSameEverywhere) {
  Computer::write(a.contacts() + "/ann.vcf", card("ann", "Ann", "ann@example.org", "1"));
  Computer::write(a.contacts() + "/bob.vcf", card("bob", "Bob", "bob@example.org", "2"));
  sync(a);
  sync(b);

  // A changes Ann's phone, B her e-mail: both survive.
  Computer::write(a.contacts() + "/ann.vcf", card("ann", "Ann", "ann@example.org", "100"));
  Computer::write(b.contacts() + "/ann.vcf", card("ann", "Ann", "ann@work.example", "1"));
  // Both rename Bob (FN and N); A's names reach the share first and win
  // everywhere.
  Computer::write(a.contacts() + "/bob.vcf", card("bob", "Robert", "bob@example.org", "2"));
  Computer::write(b.contacts() + "/bob.vcf", card("bob", "Bobby", "bob@example.org", "2"));
  sync(a);
  EXPECT_THAT(sync(b).out, HasSubstr("kept 2 conflicts"));
  sync(a);
  EXPECT_EQ(contactsOf(a)["ann.vcf"], card("ann", "Ann", "ann@work.example", "100"));
  EXPECT_EQ(contactsOf(a)["bob.vcf"], card("bob", "Robert", "bob@example.org", "2"));
  EXPECT_EQ(contactsOf(a), contactsOf(b));
  Computer::Result conflicts = b.run({"conflicts"});
  EXPECT_THAT(conflicts.out, HasSubstr(": FN  (bob.vcf, com.korvo.Contacts)"));
  EXPECT_THAT(conflicts.out, HasSubstr("FN:Bobby"));
  EXPECT_THAT(conflicts.out, HasSubstr("from Mac A"));
  EXPECT_THAT(a.run({"conflicts"}).out, HasSubstr("No conflicts"));

  // A delete travels; the other computer's files stay as they are.
  std::filesystem::remove(b.contacts() + "/ann.vcf");
  sync(b);
  sync(a);
  EXPECT_EQ(contactsOf(a).count("ann.vcf"), 0u);
  EXPECT_EQ(contactsOf(a), contactsOf(b));
}

TEST_F(AccountGuards, ADryRunSaysWhatWouldHappenAndWritesNothingAnywhere) {
  Computer::write(a.contacts() + "/ann.vcf", card("ann", "Ann", "ann@example.org", "1"));
  sync(a);
  Computer::write(b.contacts() + "/cat.vcf", card("cat", "Cat", "cat@example.org", "3"));
  const size_t requests = share.accessEntries().size();
  Computer::Result dry = b.run({"sync", "--dry-run", "-v"});
  EXPECT_EQ(dry.status, 0) << dry.err;
  EXPECT_THAT(dry.out, HasSubstr("com.korvo.Contacts (dry run): would send 1 change, receive 1 "
                                 "change and write 1 file"));
  const auto entries = share.accessEntries();
  for (size_t i = requests; i < entries.size(); ++i)
    EXPECT_THAT(entries[i].method, testing::AnyOf("PROPFIND", "GET")) << i;
  EXPECT_EQ(contactsOf(b).size(), 1u);
  // Nothing was taken in either: the real sync does all of it.
  EXPECT_THAT(sync(b).out, HasSubstr("sent 1 change, received 1 change, wrote 1 file"));
}

TEST_F(AccountGuards, TheDeleteGuardRefusesBeforeAnythingIsWrittenAnywhere) {
  for (int i = 0; i < 4; ++i)
    Computer::write(a.contacts() + "/p" + std::to_string(i) + ".vcf",
                    card("p" + std::to_string(i), "P", "p@example.org", std::to_string(i)));
  sync(a);
  sync(b);
  for (int i = 0; i < 3; ++i)
    std::filesystem::remove(a.contacts() + "/p" + std::to_string(i) + ".vcf");
  const size_t requests = share.accessEntries().size();
  Computer::Result refused = a.run({"sync"});
  EXPECT_EQ(refused.status, 6);
  EXPECT_THAT(refused.err, HasSubstr("would delete 3 of its 4 items on the other computers (75%"));
  EXPECT_THAT(refused.err, HasSubstr("--max-delete 100"));
  for (size_t i = requests; i < share.accessEntries().size(); ++i)
    EXPECT_THAT(share.accessEntries()[i].method, testing::AnyOf("PROPFIND", "GET"));
  sync(b);
  EXPECT_EQ(contactsOf(b).size(), 4u);
  // An emptied folder is never "delete everything"; a higher limit lets it through.
  std::filesystem::remove(a.contacts() + "/p3.vcf");
  EXPECT_THAT(a.run({"sync"}).err, HasSubstr("is empty but held 4 items"));
  sync(a, {"--max-delete", "100"});
  sync(b, {"--max-delete", "100"});
  EXPECT_TRUE(contactsOf(b).empty());
}

TEST_P(Account, ANewComputerJoiningAnAccountWithHistoryGetsItAllAndKeepsItsOwn) {
  Computer::write(a.contacts() + "/ann.vcf", card("ann", "Ann", "ann@example.org", "1"));
  sync(a);
  Computer::write(a.contacts() + "/ann.vcf", card("ann", "Ann", "ann@example.org", "11"));
  sync(a);
  Computer::write(a.contacts() + "/bob.vcf", card("bob", "Bob", "bob@example.org", "2"));
  std::filesystem::remove(a.contacts() + "/ann.vcf");
  Computer::write(a.contacts() + "/eve.vcf", card("eve", "Eve", "eve@example.org", "5"));
  sync(a);

  Computer c{"Mac C"};
  c.join(url, Share::kUser, Share::kPassword);
  Computer::write(c.contacts() + "/dan.vcf", card("dan", "Dan", "dan@example.org", "4"));
  EXPECT_THAT(sync(c).out, HasSubstr("(slow sync)"));
  sync(a);
  EXPECT_EQ(contactsOf(c).size(), 3u);
  EXPECT_EQ(contactsOf(c), contactsOf(a));
  EXPECT_EQ(contactsOf(c).count("ann.vcf"), 0u);
}

// A long history is written again as one reset commit. A computer with an
// edit it had not sent, and one that was away throughout, both take the new
// truth in once and lose nothing.
TEST_P(Account, CompactionKeepsAnUnsentEditAndAComputerAwayThroughoutConverges) {
  Computer c{"Mac C"};
  c.join(url, Share::kUser, Share::kPassword);
  Computer::write(a.contacts() + "/ann.vcf", card("ann", "Ann", "ann@example.org", "1"));
  Computer::write(a.contacts() + "/bob.vcf", card("bob", "Bob", "bob@example.org", "2"));
  sync(a);
  sync(b);
  sync(c);
  a.setPreference("compaction_max_changelogs", vtc::Value(3));

  Computer::write(b.contacts() + "/bob.vcf", card("bob", "Bob", "bob@home.example", "2"));
  bool compacted = false;
  for (int i = 0; i < 4; ++i) {
    Computer::write(a.contacts() + "/ann.vcf",
                    card("ann", "Ann", "ann@example.org", std::to_string(100 + i)));
    const bool now = sync(a).out.find("history compacted") != std::string::npos;
    compacted = compacted || now;
  }
  EXPECT_TRUE(compacted);
  const std::string collection = share.diskPath(std::string("/sync/Schemas/com.korvo.Contacts"));
  size_t changelogs = 0;
  for (const auto& e : std::filesystem::directory_iterator(collection))
    changelogs += e.path().extension() == ".clog";
  EXPECT_LE(changelogs, 3u);

  // Bob deleted on A after the compaction: B, whose edit of him was never
  // sent, keeps him and sends the edit; C then reads the delete and the edit
  // from the share in one slow sync and brings him back whole, as A does.
  std::filesystem::remove(a.contacts() + "/bob.vcf");
  sync(a);
  EXPECT_THAT(sync(b).out, HasSubstr("(slow sync)"));
  EXPECT_THAT(sync(c).out, HasSubstr("(slow sync)"));
  sync(a);
  const std::string bob = card("bob", "Bob", "bob@home.example", "2");
  for (const Computer* each : {&a, &b, &c}) {
    EXPECT_EQ(contactsOf(*each)["bob.vcf"], bob) << each->name();
    EXPECT_EQ(contactsOf(*each)["ann.vcf"], card("ann", "Ann", "ann@example.org", "103"))
        << each->name();
  }
  // A is told that its delete was undone.
  EXPECT_THAT(a.run({"conflicts"}).out, HasSubstr("bob.vcf"));
}

// A field edited on two computers, the second learning of the first's
// edit only through a compaction: the value that reached the share first
// wins everywhere, whenever the history was compacted, and the other is
// kept on the computer that made it.
TEST_F(AccountGuards, ACompactionBetweenTwoEditsOfAFieldDoesNotChangeWhichWins) {
  Computer::write(a.contacts() + "/ann.vcf", card("ann", "Ann", "ann@example.org", "1"));
  sync(a);
  sync(b);
  Computer::write(b.contacts() + "/ann.vcf", card("ann", "Ann", "ann@example.org", "2"));
  Computer::write(a.contacts() + "/ann.vcf", card("ann", "Ann", "ann@example.org", "3"));
  sync(a);
  EXPECT_EQ(a.run({"repair", "com.korvo.Contacts"}).status, 0);
  EXPECT_THAT(sync(b).out, HasSubstr("(slow sync)"));
  sync(a);
  EXPECT_EQ(contactsOf(a)["ann.vcf"], card("ann", "Ann", "ann@example.org", "3"));
  EXPECT_EQ(contactsOf(a), contactsOf(b));
  EXPECT_THAT(b.run({"conflicts"}).out, HasSubstr("TEL:2"));
  EXPECT_THAT(a.run({"conflicts"}).out, HasSubstr("No conflicts"));
}

// A changelog damaged on the share ends in a plain sentence, not a loop of
// downloads, until a computer whose copy is whole repairs the share.
TEST_P(Account, ADamagedShareIsReportedOnceAndRepairedFromAWholeCopy) {
  Computer::write(a.contacts() + "/ann.vcf", card("ann", "Ann", "ann@example.org", "1"));
  sync(a);
  Computer::write(a.contacts() + "/bob.vcf", card("bob", "Bob", "bob@example.org", "2"));
  sync(a);
  Computer::write(a.contacts() + "/cat.vcf", card("cat", "Cat", "cat@example.org", "3"));
  sync(a);
  const std::string second = share.diskPath("/sync/Schemas/com.korvo.Contacts/00002.clog");
  const std::string saved = Computer::read(second);
  Computer::write(second, saved.substr(0, saved.size() - 3));

  Computer::Result damaged = b.run({"sync"});
  EXPECT_EQ(damaged.status, 1);
  EXPECT_THAT(damaged.err, HasSubstr("The share's copy of com.korvo.Contacts is damaged"));
  EXPECT_THAT(damaged.err, HasSubstr("nubilosyncclient repair com.korvo.Contacts"));
  const size_t requests = share.accessEntries().size();
  Computer::Result again = b.run({"sync"});
  EXPECT_THAT(again.err, HasSubstr("was found damaged and has not changed since"));
  for (size_t i = requests; i < share.accessEntries().size(); ++i)
    EXPECT_NE(share.accessEntries()[i].method, "GET");

  // B's last sync failed: its copy may not repair the share's. A's may.
  EXPECT_THAT(b.run({"repair", "com.korvo.Contacts"}).err,
              HasSubstr("The last sync of com.korvo.Contacts on this computer did not succeed"));
  Computer::Result repaired = a.run({"repair", "com.korvo.Contacts"});
  EXPECT_EQ(repaired.status, 0) << repaired.err;
  EXPECT_THAT(repaired.out, HasSubstr("history compacted"));
  EXPECT_THAT(sync(b).out, HasSubstr("(slow sync)"));
  EXPECT_EQ(contactsOf(b).size(), 3u);
  EXPECT_EQ(contactsOf(a), contactsOf(b));
}

// A commit cut short after it published its record: the record names a
// changelog that is not there. The next computer repairs the record and
// reads from minversion.
TEST_P(Account, ARecordNamingAMissingChangelogIsRepairedAndReadFromMinversion) {
  Computer::write(a.contacts() + "/ann.vcf", card("ann", "Ann", "ann@example.org", "1"));
  sync(a);
  auto session = librarySession();
  session->setInfoForDataclass(vtc::Dictionary{{"maxversion", "00002"}}, "com.korvo.Contacts");
  EXPECT_THAT(sync(b).out, HasSubstr("(slow sync)"));
  EXPECT_EQ(contactsOf(b), contactsOf(a));
  Computer::write(b.contacts() + "/bob.vcf", card("bob", "Bob", "bob@example.org", "2"));
  sync(b);
  sync(a);
  EXPECT_EQ(contactsOf(a).size(), 2u);
  EXPECT_EQ(contactsOf(a), contactsOf(b));
}

// What people use every day: khard and khal write and read the folders.
class WithPrograms : public TwoComputers {
 protected:
  void SetUp() override {
    TwoComputers::SetUp();
    for (const Computer* c : {&a, &b}) {
      Computer::write(c->home() + "/.config/khard/khard.conf",
                      "[addressbooks]\n[[people]]\npath = " + c->contacts() +
                          "\n[general]\neditor = /bin/true\nmerge_editor = /bin/true\n");
      Computer::write(c->home() + "/.config/khal/config",
                      "[calendars]\n[[home]]\npath = " + c->calendars() +
                          "\ntype = calendar\n[locale]\ntimeformat = %H:%M\n"
                          "dateformat = %Y-%m-%d\nlongdateformat = %Y-%m-%d\n"
                          "datetimeformat = %Y-%m-%d %H:%M\nlongdatetimeformat = %Y-%m-%d %H:%M\n"
                          "default_timezone = UTC\nlocal_timezone = UTC\n"
                          "[default]\ndefault_calendar = home\n");
    }
  }
  // A command line run in the computer's home; its output.
  std::string program(const Computer& c, const std::string& command) {
    const std::string line = "HOME='" + c.home() + "' XDG_CONFIG_HOME='" + c.home() +
                             "/.config' XDG_DATA_HOME='" + c.home() +
                             "/.local/share' LC_ALL=C.UTF-8 " + command + " 2>&1";
    FILE* pipe = ::popen(line.c_str(), "r");
    std::string out;
    char buffer[4096];
    for (size_t n; pipe && (n = std::fread(buffer, 1, sizeof buffer, pipe)) > 0;)
      out.append(buffer, n);
    EXPECT_EQ(pipe ? ::pclose(pipe) : -1, 0) << command << "\n" << out;
    return out;
  }
};

TEST_F(WithPrograms, AContactFromKhardAndAnEventFromKhalReachTheOtherComputer) {
  Computer::write(a.home() + "/ada.yaml",
                  "First name : Ada\nLast name : Lovelace\nEmail :\n    home : ada@example.org\n");
  program(a, "khard new --input-file '" + a.home() + "/ada.yaml' -a people");
  program(b, "khal new 2025-03-10 09:00 10:00 Stand-up");
  sync(a);
  sync(b);
  sync(a);
  EXPECT_THAT(program(b, "khard list"), HasSubstr("Ada Lovelace"));
  EXPECT_THAT(program(a, "khal list -f '{start-time} {title}' 2025-03-10 1d"),
              HasSubstr("09:00 Stand-up"));

  // Edited with khard on B, the e-mail reaches A.
  Computer::write(b.home() + "/edit.yaml",
                  "First name : Ada\nLast name : Lovelace\nEmail :\n    work : ada@work.example\n");
  program(b, "sh -c \"echo y | khard edit -i '" + b.home() + "/edit.yaml' Ada\"");
  sync(b);
  sync(a);
  EXPECT_THAT(program(a, "khard show Ada"), HasSubstr("ada@work.example"));
  EXPECT_EQ(Computer::files(a.calendars()), Computer::files(b.calendars()));
}

}  // namespace
