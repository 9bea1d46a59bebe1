// Syncs that are cut short or run into each other: a client killed with
// SIGKILL at each step of a new computer's first sync, of a commit and of a
// compaction, and halfway through writing files; a second run while one is
// under way; a file edited while the sync writes it. Afterwards the next
// syncs of every computer converge with nobody acting: the whole data set
// everywhere, nothing lost and nothing twice, no conflict nobody made, no
// change sent back.
#include <gmock/gmock.h>
#include <signal.h>
#include <sys/inotify.h>
#include <unistd.h>

#include <filesystem>
#include <regex>
#include <set>

#include "VantorSyncManager/NubiloRemoteSession.h"
#include "localshare/ApacheShare.h"
#include "localshare/Computer.h"
#include "localshare/Processes.h"
#include "support/FaultProxy.h"
#include "support/TestHome.h"

using testing::HasSubstr;
using vtc::local::ApacheShare;
using vtc::local::Computer;

namespace {

std::string card(int i, const std::string& tel = "1") {
  const std::string n = std::to_string(i);
  return "BEGIN:VCARD\r\nVERSION:3.0\r\nUID:p" + n + "\r\nFN:Person " + n + "\r\nTEL:" + tel +
         "\r\nEND:VCARD\r\n";
}

class Interrupted : public ::testing::Test {
 protected:
  vtc::test::TestHome home;
  ApacheShare share;
  vtc::test::FaultProxy proxy{share.port()};
  // A goes through the proxy, which can hold its requests; B goes direct.
  Computer a{"Mac A"};
  Computer b{"Mac B"};

  void SetUp() override {
    a.join("http://127.0.0.1:" + std::to_string(proxy.port()) + "/sync", ApacheShare::kUser,
           ApacheShare::kPassword);
    b.join("http://127.0.0.1:" + std::to_string(share.port()) + "/sync", ApacheShare::kUser,
           ApacheShare::kPassword);
  }

  Computer::Result sync(const Computer& c) {
    Computer::Result r = c.run({"sync"});
    EXPECT_EQ(r.status, 0) << c.name() << ": " << r.err << r.out;
    return r;
  }
  // Starts A's sync and waits until the proxy holds its request, or has
  // forwarded it and the server has carried it out (answerLost).
  pid_t stopAt(const vtc::test::Match& match, bool answerLost = false) {
    const size_t done = countOnShare(match.method);
    if (answerLost)
      proxy.loseAnswer(match);
    else
      proxy.timeOut(match);
    pid_t pid = a.start({"sync"});
    EXPECT_TRUE(vtc::local::waitUntil([&] {
      for (const auto& seen : proxy.requests())
        if (seen.method == match.method && seen.action != "forwarded") return true;
      return false;
    })) << "A never sent "
        << match.method;
    if (answerLost) {
      EXPECT_TRUE(vtc::local::waitUntil([&] { return countOnShare(match.method) > done; }));
    }
    return pid;
  }
  pid_t stopAt(const std::string& method, const std::string& path = "") {
    return stopAt({method, path, 1});
  }
  void kill(pid_t pid) {
    ::kill(pid, SIGKILL);
    EXPECT_EQ(a.finish(pid).status, 128 + SIGKILL);
    proxy.clear();
  }
  size_t countOnShare(const std::string& method) const {
    size_t n = 0;
    for (const auto& entry : share.accessEntries()) n += entry.method == method;
    return n;
  }
  // Every computer holds exactly these cards, each once.
  void expectEverywhere(const std::map<std::string, std::string>& cards) {
    for (const Computer* c : {&a, &b}) {
      auto files = Computer::files(c->contacts());
      EXPECT_EQ(files, cards) << c->name();
      std::set<std::string> uids;
      for (const auto& [name, content] : files) uids.insert(content.substr(0, content.find("FN")));
      EXPECT_EQ(uids.size(), files.size()) << c->name() << " holds a card twice";
    }
  }
  // How many changes a sync says it sent.
  static int sent(const Computer::Result& r) {
    static const std::regex said("sent ([0-9]+) change");
    std::smatch m;
    return std::regex_search(r.out, m, said) ? std::stoi(m[1]) : -1;
  }
};

TEST_F(Interrupted, ASecondRunIsRefusedAndARunKilledAfterReadingTheFolderLosesNothing) {
  std::map<std::string, std::string> cards;
  for (int i = 0; i < 5; ++i) cards["p" + std::to_string(i) + ".vcf"] = card(i);
  for (const auto& [name, content] : cards) Computer::write(a.contacts() + "/" + name, content);

  pid_t first = stopAt("LOCK");
  Computer::Result second = a.run({"sync"});
  EXPECT_EQ(second.status, 5);
  EXPECT_THAT(second.err, HasSubstr("Another sync is running (process " + std::to_string(first)));
  kill(first);

  sync(a);
  sync(b);
  expectEverywhere(cards);
}

TEST_F(Interrupted, ARunKilledAfterCommittingAndBeforeUnlockingLeavesNoLockBehind) {
  std::map<std::string, std::string> cards;
  for (int i = 0; i < 5; ++i) cards["p" + std::to_string(i) + ".vcf"] = card(i);
  for (const auto& [name, content] : cards) Computer::write(a.contacts() + "/" + name, content);
  kill(stopAt("UNLOCK", "/sync/Schemas/com.korvo.Contacts/"));

  // The next run gives the dead run's locks back instead of waiting for them.
  Computer::write(a.contacts() + "/p0.vcf", card(0, "100"));
  cards["p0.vcf"] = card(0, "100");
  sync(a);
  sync(b);
  expectEverywhere(cards);
}

TEST_F(Interrupted, ARunKilledHalfwayThroughWritingFilesConvergesOnTheNextRun) {
  constexpr int kCards = 400;
  std::map<std::string, std::string> cards;
  for (int i = 0; i < kCards; ++i) cards["p" + std::to_string(i) + ".vcf"] = card(i);
  for (const auto& [name, content] : cards) Computer::write(b.contacts() + "/" + name, content);
  sync(b);

  // A takes the cards in; it is killed once half of them are in place.
  int watch = ::inotify_init1(IN_CLOEXEC);
  ASSERT_GE(::inotify_add_watch(watch, a.contacts().c_str(), IN_MOVED_TO | IN_CREATE), 0);
  pid_t pid = a.start({"sync"});
  int placed = 0;
  alignas(inotify_event) char buffer[64 * 1024];
  while (placed < kCards / 2) {
    ssize_t n = ::read(watch, buffer, sizeof buffer);
    ASSERT_GT(n, 0);
    for (char* p = buffer; p < buffer + n;) {
      auto* event = reinterpret_cast<inotify_event*>(p);
      if (event->mask & IN_MOVED_TO) ++placed;
      p += sizeof(inotify_event) + event->len;
    }
  }
  ::kill(pid, SIGKILL);
  ::close(watch);
  const size_t written = Computer::files(a.contacts()).size();
  EXPECT_EQ(a.finish(pid).status, 128 + SIGKILL);
  EXPECT_GT(written, 0u);
  EXPECT_LT(written, static_cast<size_t>(kCards)) << "the run ended before it was killed";
  // What a write cut short leaves (the kill may have left one too), and
  // files of the same look that are not the client's.
  const std::string leftover = "/.0F8E2C3A-5B7D-4E21-9A64-3C1D2E5F7A90.tmp";
  Computer::write(a.contacts() + leftover, "");
  Computer::write(a.contacts() + "/.notes.tmp", "mine");
  Computer::write(a.contacts() + "/.0F8E2C3A.tmp", "mine");

  EXPECT_THAT(sync(a).out, HasSubstr("sent 0 changes"));
  sync(b);
  expectEverywhere(cards);
  for (const Computer* c : {&a, &b})
    EXPECT_THAT(c->run({"conflicts"}).out, HasSubstr("No conflicts")) << c->name();
  std::set<std::string> hidden;
  for (const auto& entry : std::filesystem::directory_iterator(a.contacts()))
    if (!entry.path().filename().string().ends_with(".vcf"))
      hidden.insert(entry.path().filename().string());
  EXPECT_EQ(hidden, (std::set<std::string>{".0F8E2C3A.tmp", ".notes.tmp"}));
}

TEST_F(Interrupted, AFileEditedWhileTheSyncWritesItIsKeptAndMergedNextTime) {
  Computer::write(a.contacts() + "/p1.vcf", card(1));
  sync(a);
  sync(b);
  // B renames Ann's phone; A then edits the same card while its sync runs,
  // after it read the folder and before it writes B's change.
  Computer::write(b.contacts() + "/p1.vcf", card(1, "200"));
  sync(b);
  proxy.delay({"LOCK", "", 1}, 400);
  pid_t pid = a.start({"sync", "-v"});
  ASSERT_TRUE(vtc::local::waitUntil([&] { return !proxy.requests().empty(); }));
  ASSERT_TRUE(vtc::local::waitUntil([&] {
    for (const auto& seen : proxy.requests())
      if (seen.action == "delayed") return true;
    return false;
  }));
  const std::string edited =
      "BEGIN:VCARD\r\nVERSION:3.0\r\nUID:p1\r\nFN:Person One\r\nTEL:1\r\nEND:VCARD\r\n";
  Computer::write(a.contacts() + "/p1.vcf", edited);
  Computer::Result r = a.finish(pid);
  EXPECT_EQ(r.status, 0) << r.err;
  EXPECT_THAT(r.out, HasSubstr("changed meanwhile"));
  EXPECT_EQ(Computer::read(a.contacts() + "/p1.vcf"), edited);
  proxy.clear();

  // The edit goes out with the next sync and both changes stand.
  sync(a);
  sync(b);
  const std::string merged =
      "BEGIN:VCARD\r\nVERSION:3.0\r\nUID:p1\r\nFN:Person One\r\nTEL:200\r\nEND:VCARD\r\n";
  expectEverywhere({{"p1.vcf", merged}});
}

// The steps a run can be killed at: the request the proxy holds when it is
// killed, or (answerLost) one the server carried out while the run never
// heard of it.
struct KillPoint {
  const char* name;
  // FirstOnTheShare: A is the share's first computer; FirstSync: A joins
  // while B's cards are there; Commit: both synced, each then edits a card
  // and B syncs; Compaction: as Commit, A compacts the history first.
  enum Stage { FirstOnTheShare, FirstSync, Commit, Compaction } stage;
  vtc::test::Match request;
  bool answerLost = false;
  bool committed = false;  // A's changes were on the share when it was killed
};

void PrintTo(const KillPoint& point, std::ostream* out) {
  *out << point.name;
}

constexpr const char* kCollection = "/sync/Schemas/com.korvo.Contacts";

const KillPoint kKillPoints[] = {
    {"FirstCommitOnTheShareAfterItsRecordUpdate", KillPoint::FirstOnTheShare, {"MOVE", "", 1}},
    {"FirstSyncAfterReadingTheFolder", KillPoint::FirstSync, {"LOCK", "", 1}},
    {"FirstSyncAfterItsDownloads", KillPoint::FirstSync, {"PUT", "", 1}},
    {"FirstCommitAfterThePutOfItsChangelog",
     KillPoint::FirstSync,
     {"PROPPATCH", kCollection, 1, "PUT"}},
    {"FirstCommitAfterItsRecordUpdate", KillPoint::FirstSync, {"MOVE", "", 1}},
    {"FirstCommitBeforeHearingOfItsMove", KillPoint::FirstSync, {"MOVE", "", 1}, true, true},
    {"FirstSyncBeforeWritingFiles", KillPoint::FirstSync, {"UNLOCK", kCollection, 1}, false, true},
    {"CommitAfterThePutOfItsChangelog", KillPoint::Commit, {"PROPPATCH", kCollection, 1, "PUT"}},
    {"CommitAfterItsRecordUpdate", KillPoint::Commit, {"MOVE", "", 1}},
    {"CommitBeforeHearingOfItsMove", KillPoint::Commit, {"MOVE", "", 1}, true, true},
    {"CompactionAfterThePutOfItsChangelog",
     KillPoint::Compaction,
     {"PROPPATCH", kCollection, 1, "PUT"}},
    {"CompactionAfterItsRecordUpdate", KillPoint::Compaction, {"MOVE", "", 1}},
    {"CompactionWhileDeletingTheOldHistory", KillPoint::Compaction, {"DELETE", "", 2}},
    {"CompactionDoneBeforeTheCommitAfterIt", KillPoint::Compaction, {"PUT", "", 2}},
};

class KilledAt : public Interrupted, public ::testing::WithParamInterface<KillPoint> {
 protected:
  // The share's collection as a session sees it: its record is sound, and
  // it holds no temporary changelog and nothing below minversion.
  void expectTidyShare() {
    vtc::Dictionary config = share.configuration();
    config.set("sync_path", vtc::Value("/sync"));
    auto session = NubiloRemoteSession::sessionWithUsername(ApacheShare::kUser,
                                                            ApacheShare::kPassword, config);
    EXPECT_TRUE(session->validPropertiesForDataclass("com.korvo.Contacts"));
    const std::string min =
        session->getDataclassInfo("com.korvo.Contacts").get("minversion").string();
    for (const std::string& member : share.members(kCollection)) {
      EXPECT_FALSE(member.ends_with(".tmp")) << member;
      EXPECT_GE(member, min) << "below minversion";
    }
  }
};

INSTANTIATE_TEST_SUITE_P(Steps, KilledAt, ::testing::ValuesIn(kKillPoints),
                         [](const auto& info) { return std::string(info.param.name); });

TEST_P(KilledAt, TheNextSyncsConvergeWithNobodyActing) {
  const KillPoint& point = GetParam();
  std::map<std::string, std::string> cards;
  for (int i = 0; i < 5; ++i) cards["p" + std::to_string(i) + ".vcf"] = card(i);
  for (const auto& [name, content] : cards) Computer::write(b.contacts() + "/" + name, content);
  cards["p9.vcf"] = card(9);
  Computer::write(a.contacts() + "/p9.vcf", card(9));
  if (point.stage != KillPoint::FirstOnTheShare) sync(b);
  if (point.stage >= KillPoint::Commit) {
    sync(a);
    sync(b);
    // Each edits a card of its own; B's edit is on the share first.
    cards["p1.vcf"] = card(1, "100");
    cards["p3.vcf"] = card(3, "300");
    Computer::write(a.contacts() + "/p1.vcf", cards["p1.vcf"]);
    Computer::write(b.contacts() + "/p3.vcf", cards["p3.vcf"]);
    sync(b);
  }
  if (point.stage == KillPoint::Compaction)
    a.setPreference("compaction_max_changelogs", vtc::Value(2));
  kill(stopAt(point.request, point.answerLost));
  const int unsent = point.committed ? 0 : 1;  // A's changes not on the share

  // Every computer syncs in turn: nobody repairs, nothing is refused.
  int sentAfter = 0;
  for (const Computer* c : {&a, &b, &a, &b}) sentAfter += sent(sync(*c));
  // B sends its own cards when A was the share's first computer.
  EXPECT_EQ(sentAfter, unsent + (point.stage == KillPoint::FirstOnTheShare ? 5 : 0))
      << "a change was sent twice";
  expectEverywhere(cards);
  for (const Computer* c : {&a, &b})
    EXPECT_THAT(c->run({"conflicts"}).out, HasSubstr("No conflicts")) << c->name();
  for (const Computer* c : {&a, &b})
    EXPECT_THAT(sync(*c).out, HasSubstr("sent 0 changes, received 0 changes")) << c->name();

  // The killed run's temporary changelog stays while its lock could last,
  // and goes with the next sync that locks the collection after that; so
  // do changelogs a compaction left below minversion.
  std::vector<std::string> temporary;
  for (const std::string& member : share.members(kCollection))
    if (member.ends_with(".tmp")) temporary.push_back(member);
  const std::string& held = point.request.method;
  if ((held == "PROPPATCH" || held == "MOVE") && !point.answerLost) {
    EXPECT_FALSE(temporary.empty()) << "the killed run left no temporary changelog";
  }
  const auto anHourAgo = std::filesystem::file_time_type::clock::now() - std::chrono::hours(1);
  for (const std::string& name : temporary)
    std::filesystem::last_write_time(share.diskPath(std::string(kCollection) + "/" + name),
                                     anHourAgo);
  cards["p4.vcf"] = card(4, "400");
  Computer::write(b.contacts() + "/p4.vcf", cards["p4.vcf"]);
  sync(b);
  sync(a);
  expectEverywhere(cards);
  expectTidyShare();
}

}  // namespace
