// What the client says when things go wrong or are about to happen: a
// server that is down, a lock another computer holds (and one it left,
// taken over), a name that is not
// synced, a password refused at setup, a dry run and a deletion counted in
// words, a report that fails after the commit. Every sentence is the
// user's: no type names or codes of the program's inside.
#include <gmock/gmock.h>
#include <signal.h>

#include <chrono>
#include <nlohmann/json.hpp>

#include "client/run/ForeignLocks.h"
#include "localshare/ApacheShare.h"
#include "localshare/Computer.h"
#include "localshare/Processes.h"
#include "support/FaultProxy.h"
#include "support/TestHome.h"

using testing::HasSubstr;
using testing::Not;
using vtc::local::ApacheShare;
using vtc::local::Computer;

namespace {

std::string card(const std::string& uid, const std::string& fn, const std::string& tel = "1") {
  return "BEGIN:VCARD\r\nVERSION:3.0\r\nUID:" + uid + "\r\nFN:" + fn + "\r\nTEL:" + tel +
         "\r\nEND:VCARD\r\n";
}

class Messages : public ::testing::Test {
 protected:
  vtc::test::TestHome home;
  ApacheShare share;
  vtc::test::FaultProxy proxy{share.port()};
  std::string url = "http://127.0.0.1:" + std::to_string(share.port()) + "/sync";
  // A goes through the proxy; B goes direct.
  Computer a{"Mac A"};
  Computer b{"Mac B"};

  void SetUp() override {
    a.join("http://127.0.0.1:" + std::to_string(proxy.port()) + "/sync", ApacheShare::kUser,
           ApacheShare::kPassword);
    b.join(url, ApacheShare::kUser, ApacheShare::kPassword);
  }
  // Runs the client and checks that nothing of the program's insides shows.
  Computer::Result run(const Computer& c, const std::vector<std::string>& args) {
    Computer::Result r = c.run(args);
    for (const char* inside :
         {"DavTransaction", "kNB", "Exception", "std::", "runtime_error", "(null)"})
      EXPECT_THAT(r.out + r.err, Not(HasSubstr(inside))) << c.name() << " " << args.front();
    return r;
  }
  // The requests the proxy keeps waiting: A's commits, held.
  size_t heldPuts() const {
    size_t held = 0;
    for (const auto& seen : proxy.requests())
      held += seen.method == "PUT" && seen.action == "timed out";
    return held;
  }
  static std::string guidOf(Computer::Result status) {
    return nlohmann::json::parse(status.out)["computer"]["guid"].get<std::string>();
  }
};

TEST_F(Messages, AServerThatIsDownIsToldAtOnceAndStatusKeepsTheAttemptWithItsReason) {
  Computer::write(b.contacts() + "/ann.vcf", card("ann", "Ann"));
  ASSERT_EQ(run(b, {"sync"}).status, 0);
  share.stop();
  b.setEnvironment("NUBILO_WAIT_SCALE", "1");  // the protocol's real waits
  const auto start = std::chrono::steady_clock::now();
  Computer::Result down = run(b, {"sync"});
  EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(3));
  EXPECT_EQ(down.status, 4);
  EXPECT_EQ(down.err, "nubilosyncclient: Cannot reach the server at " +
                          url.substr(0, url.size() - 5) +
                          " (connection refused); check the address and the network.\n");
  Computer::Result status = run(b, {"status"});
  EXPECT_THAT(status.out, HasSubstr("1 failed sync since: Cannot reach the server at"));
}

TEST_F(Messages, ALockNamesItsHolderAndHowLongItLastsAndOneLeftUnrenewedIsTakenOver) {
  Computer::write(a.contacts() + "/ann.vcf", card("ann", "Ann"));
  ASSERT_EQ(run(a, {"sync"}).status, 0);
  // A holds its lock while the share keeps its commit waiting.
  Computer::write(a.contacts() + "/ann.vcf", card("ann", "Ann", "2"));
  proxy.timeOut({"PUT", "", 0});
  const pid_t held = a.start({"sync", "com.korvo.Contacts"});
  ASSERT_TRUE(vtc::local::waitUntil([&] { return heldPuts() == 1; }));
  Computer::Result locked = run(b, {"sync", "com.korvo.Contacts"});
  EXPECT_EQ(locked.status, 1);
  EXPECT_THAT(locked.err, testing::ContainsRegex(
                              "com\\.korvo\\.Contacts is locked by Mac A, which is syncing it "
                              "\\(since 20[0-9-]{8} [0-9:]{8}\\); its lock ends within [0-9]+ "
                              "minutes at the latest, even if Mac A stopped; try again then\\."));
  ::kill(held, SIGKILL);
  a.finish(held);

  // A's next run gives its own leftover back; killed again, with a lock
  // nobody renews (a short one here, as if taken long ago), it is taken over
  // at once by B, on a terminal, with a sentence naming A.
  a.setPreference("lock_duration_seconds", vtc::Value(int64_t{3}));
  const pid_t again = a.start({"sync", "com.korvo.Contacts"});
  ASSERT_TRUE(vtc::local::waitUntil([&] { return heldPuts() == 2; }));
  ::kill(again, SIGKILL);
  a.finish(again);
  Computer::Result taken = b.runOnTerminal({"sync", "com.korvo.Contacts"});
  EXPECT_EQ(taken.status, 0) << taken.out;
  EXPECT_THAT(taken.out, testing::ContainsRegex(
                             "nubilosyncclient: Took over the lock of com\\.korvo\\.Contacts that "
                             "Mac A took at 20[0-9-]{8} [0-9:]{8} and stopped renewing: its sync "
                             "ended without giving the lock back\\."));
  EXPECT_THAT(taken.out, HasSubstr("com.korvo.Contacts: sent 0 changes, received 1 change"));
  // A lock renewed lately is not taken.
  EXPECT_FALSE(vtc::client::abandonedLock(vtc::Dictionary{{"timeout", "Second-100"}}, 240));
  EXPECT_TRUE(vtc::client::abandonedLock(vtc::Dictionary{{"timeout", "Second-90"}}, 240));
}

TEST_F(Messages, AdviceFitsWhatTheUserDid) {
  // A name that is not synced names those that are.
  Computer::Result repair = run(b, {"repair", "Contacts"});
  EXPECT_EQ(repair.status, 2);
  EXPECT_EQ(repair.err,
            "nubilosyncclient: Contacts is not synced on this computer; its synced folders are "
            "com.korvo.Contacts, com.korvo.Calendars.\n");
  // A wrong password at setup: check it, not "store" it.
  Computer w{"Mac W"};
  Computer::Result wrong = run(w, {"setup", url, "--user", ApacheShare::kUser, "--password-command",
                                   "printf nope", "--allow-insecure"});
  EXPECT_EQ(wrong.status, 3);
  EXPECT_THAT(wrong.err, HasSubstr("refused the password for alice; check the member name and "
                                   "the password, then run setup again."));
  // Setup again with folders: no advice to add one.
  Computer::Result again = run(b, {"setup", url, "--user", ApacheShare::kUser, "--password-command",
                                   "cat '" + b.home() + "/.password'", "--allow-insecure"});
  EXPECT_EQ(again.status, 0) << again.err;
  EXPECT_THAT(again.out, HasSubstr("Its folders stay as they were; run `nubilosyncclient sync`."));
  EXPECT_THAT(again.out, Not(HasSubstr("Add a folder")));
}

TEST_F(Messages, ADryRunAndADeletionAreCountedInWordsAndALateReportFailureIsNoFailure) {
  Computer::write(a.contacts() + "/ann.vcf", card("ann", "Ann Smith"));
  Computer::write(a.contacts() + "/bob.vcf", card("bob", "Bob Jones"));
  ASSERT_EQ(run(a, {"sync"}).status, 0);
  ASSERT_EQ(run(b, {"sync"}).status, 0);
  std::filesystem::remove(a.contacts() + "/bob.vcf");
  Computer::write(a.contacts() + "/ann.vcf", card("ann", "Ann Smith", "2"));

  // The record of A on the share cannot be written after the commit.
  proxy.dropConnection(
      {"PROPPATCH", "/sync/Clients/" + guidOf(a.run({"status", "--json"})) + ".client"});
  Computer::Result sent = run(a, {"sync"});
  EXPECT_EQ(sent.status, 0) << sent.err;
  EXPECT_EQ(sent.out, "Synced 2 folders: sent 2 changes, received 0 changes, wrote 0 files.\n");
  EXPECT_GE(proxy.count("PROPPATCH"), 1u);

  Computer::Result dry = run(b, {"sync", "--dry-run"});
  EXPECT_EQ(dry.status, 0) << dry.err;
  EXPECT_EQ(dry.out,
            "Dry run of 2 folders: would send 0 changes, receive 2 changes and write 1 file and "
            "delete 1 file.\n"
            "  Ann Smith (ann.vcf): would be changed here\n"
            "  Bob Jones (bob.vcf): would be deleted here\n");
  Computer::Result real = run(b, {"sync", "-v"});
  EXPECT_EQ(real.status, 0) << real.err;
  EXPECT_THAT(real.out, HasSubstr("com.korvo.Contacts: sent 0 changes, received 2 changes, wrote 1 "
                                  "file and deleted 1 file\n"
                                  "  Ann Smith (ann.vcf): changed here\n"
                                  "  Bob Jones (bob.vcf): deleted here\n"));
  EXPECT_EQ(Computer::files(b.contacts()), Computer::files(a.contacts()));
}

}  // namespace
