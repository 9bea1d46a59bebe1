// Syncs that are cut short or run into each other: a client killed with
// SIGKILL after reading its folder, after committing and before unlocking,
// and halfway through writing files; a second run while one is under way;
// a file edited while the sync writes it. Afterwards every computer holds
// the whole data set, nothing lost and nothing twice.
#include <gmock/gmock.h>
#include <signal.h>
#include <sys/inotify.h>
#include <unistd.h>

#include <filesystem>
#include <set>

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

  void sync(const Computer& c) {
    Computer::Result r = c.run({"sync"});
    EXPECT_EQ(r.status, 0) << c.name() << ": " << r.err << r.out;
  }
  // Starts A's sync and waits until the proxy holds its request.
  pid_t stopAt(const std::string& method, const std::string& path = "") {
    proxy.timeOut({method, path, 1});
    pid_t pid = a.start({"sync"});
    EXPECT_TRUE(vtc::local::waitUntil([&] {
      for (const auto& seen : proxy.requests())
        if (seen.method == method && seen.action == "timed out") return true;
      return false;
    }));
    return pid;
  }
  void kill(pid_t pid) {
    ::kill(pid, SIGKILL);
    EXPECT_EQ(a.finish(pid).status, 128 + SIGKILL);
    proxy.clear();
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

  sync(a);
  sync(b);
  expectEverywhere(cards);
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

}  // namespace
