// Push between two computers of one account: a real share, a real push
// server, each computer a home of its own running nubilosyncclient as
// programs. B runs `listen` in the foreground (there is no user manager in
// these tests: `systemctl` and `crontab` are stand-ins on the computers'
// PATH that record their arguments and refuse, as without a manager).
#include <gmock/gmock.h>

#include <signal.h>
#include <sys/stat.h>

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <thread>

#include "localshare/ApacheShare.h"
#include "localshare/Computer.h"
#include "localshare/Processes.h"
#include "platform/os/HostIdentity.h"
#include "platform/plist/PlistCodec.h"
#include "platform/push/MqttConnection.h"
#include "platform/push/PushService.h"
#include "support/MqttBroker.h"
#include "support/TestHome.h"

using testing::HasSubstr;
using vtc::local::ApacheShare;
using vtc::local::Computer;
using Clock = std::chrono::steady_clock;

namespace {

std::string card(const std::string& uid, const std::string& tel) {
  return "BEGIN:VCARD\r\nVERSION:3.0\r\nUID:" + uid + "\r\nFN:" + uid + "\r\nN:" + uid +
         ";;;;\r\nTEL:" + tel + "\r\nEND:VCARD\r\n";
}

size_t occurrences(const std::string& text, const std::string& what) {
  size_t n = 0;
  for (size_t at = text.find(what); at != std::string::npos; at = text.find(what, at + 1)) ++n;
  return n;
}

class Push : public ::testing::Test {
 protected:
  vtc::test::TestHome home;
  ApacheShare share;
  vtc::test::MqttBroker broker;
  std::string url = "http://127.0.0.1:" + std::to_string(share.port()) + "/sync";
  Computer a{"Mac A"};
  Computer b{"Mac B"};
  pid_t listener = -1;

  void SetUp() override {
    const std::string stubs = home.path() + "/stand-ins";
    std::filesystem::create_directories(stubs);
    for (const char* program : {"systemctl", "crontab"}) {
      const std::string path = stubs + "/" + program;
      Computer::write(path, std::string("#!/bin/sh\nprintf '%s\\n' \"$*\" >> \"$HOME/.") + program +
                                "-calls\"\necho 'Failed to connect to bus: No medium found' >&2\n"
                                "exit 1\n");
      ::chmod(path.c_str(), 0755);
    }
    for (Computer* c : {&a, &b}) {
      c->setEnvironment("PATH", stubs + ":" + std::getenv("PATH"));
      c->join(url, ApacheShare::kUser, ApacheShare::kPassword, {"--push", broker.url()});
    }
    Computer::Result on = b.run({"push", "on"});
    ASSERT_EQ(on.status, 0) << on.err << on.out;
    EXPECT_THAT(on.out, HasSubstr("run `nubilosyncclient listen`"));  // no user manager here
  }
  void TearDown() override { stopListening(); }

  static std::string logOf(const Computer& c) {
    return Computer::read(c.home() + "/Library/Logs/Sync/nubilosync.log");
  }
  // Starts B's listener and waits until it has subscribed.
  void listen() {
    const size_t before = occurrences(logOf(b), "Listening for pushes");
    listener = b.start({"listen"});
    ASSERT_TRUE(vtc::local::waitUntil([&] {
      return occurrences(logOf(b), "Listening for pushes") > before;
    })) << logOf(b);
  }
  void stopListening() {
    if (listener <= 0) return;
    ::kill(listener, SIGTERM);
    Computer::Result r = b.finish(listener);
    listener = -1;
    EXPECT_EQ(r.status, 0) << r.err;
  }
  void syncA() {
    Computer::Result r = a.run({"sync"});
    ASSERT_EQ(r.status, 0) << r.err << r.out;
  }
  // How long until B's contact holds the text (none after five seconds).
  std::optional<double> secondsUntilBHas(const std::string& content) {
    const auto start = Clock::now();
    while (Clock::now() - start < std::chrono::seconds(5)) {
      if (Computer::read(b.contacts() + "/ann.vcf") == content)
        return std::chrono::duration<double>(Clock::now() - start).count();
      std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
    return std::nullopt;
  }
  size_t runsOfB() { return occurrences(logOf(b), "|Info|Running "); }
};

TEST_F(Push, AnEditSyncedOnAReachesBWithinTwoSecondsWithNoCommandTypedOnB) {
  Computer::write(a.contacts() + "/ann.vcf", card("ann", "0"));
  syncA();
  listen();
  std::vector<double> delays;
  for (int i = 1; i <= 20; ++i) {
    const std::string edited = card("ann", std::to_string(i));
    Computer::write(a.contacts() + "/ann.vcf", edited);
    syncA();  // announces the new changelog as it ends
    std::optional<double> delay = secondsUntilBHas(edited);
    ASSERT_TRUE(delay) << "edit " << i << " never reached B:\n" << logOf(b);
    EXPECT_LT(*delay, 2.0) << "edit " << i;
    delays.push_back(*delay);
  }
  std::ranges::sort(delays);
  const double median = (delays[9] + delays[10]) / 2;
  RecordProperty("median_push_delay_ms", static_cast<int>(median * 1000));
  std::cout << "[ push ] median delay over 20 edits: " << static_cast<int>(median * 1000)
            << " ms (fastest " << static_cast<int>(delays.front() * 1000) << " ms, slowest "
            << static_cast<int>(delays.back() * 1000) << " ms)\n";
  EXPECT_EQ(runsOfB(), 20u) << "one run a push, no more";
}

TEST_F(Push, ABurstOfTenPushesGivesAtMostTwoRunsAndBsOwnAnnouncementsNone) {
  listen();
  std::optional<vtc::Dictionary> topic;
  ASSERT_EQ(vtc::push::createTopic(ApacheShare::kUser, "korvo", "nubilo", "syncdav",
                                   "com.korvo.Contacts", topic),
            0);
  vtc::push::MqttConnection::Options options;
  options.broker = *vtc::push::BrokerAddress::parse(broker.url());
  options.clientId = "another-computer";
  options.username = ApacheShare::kUser;
  options.password = ApacheShare::kPassword;
  vtc::push::MqttConnection other(options);
  std::string error;
  ASSERT_TRUE(other.connect(error)) << error;
  auto announce = [&](const std::string& guid) {
    const vtc::Bytes payload = vtc::plist::toBinary(vtc::Value(vtc::Dictionary{{"guid", guid}}));
    ASSERT_TRUE(other.publish(topic->get(vtc::push::kTopicKey).string(), payload, error)) << error;
  };

  const vtc::Value bPrefs = vtc::plist::readFile(b.perHostFile()).value_or(vtc::Value());
  announce(bPrefs.dictionary().get("ClientGuid").string());
  std::this_thread::sleep_for(std::chrono::milliseconds(500));
  EXPECT_EQ(runsOfB(), 0u) << "B answered its own announcement";

  for (int i = 0; i < 10; ++i) {
    announce("AAAAAAAA-0000-0000-0000-00000000000" + std::to_string(i % 10));
    std::this_thread::sleep_for(std::chrono::milliseconds(95));
  }
  ASSERT_TRUE(vtc::local::waitUntil([&] { return runsOfB() >= 1; }));
  std::this_thread::sleep_for(std::chrono::milliseconds(1500));  // room for a third run
  EXPECT_LE(runsOfB(), 2u) << logOf(b);

  // A message of 20 MB (the server keeps it back: B told it the largest it
  // takes) and one nested four thousand deep (no announcement: ignored):
  // neither starts a run, and the listener stays small.
  const size_t runs = runsOfB();
  const std::string topicText = topic->get(vtc::push::kTopicKey).string();
  ASSERT_TRUE(other.publish(topicText, vtc::Bytes(20 << 20, 'x'), error)) << error;
  std::string deep = "<plist version=\"1.0\">";
  for (int i = 0; i < 4000; ++i) deep = deep + "<array>";
  for (int i = 0; i < 4000; ++i) deep += "</array>";
  deep += "</plist>";
  ASSERT_LT(deep.size(), 64u << 10);
  ASSERT_TRUE(other.publish(topicText, vtc::Bytes(deep.begin(), deep.end()), error)) << error;
  std::this_thread::sleep_for(std::chrono::milliseconds(1000));
  EXPECT_EQ(runsOfB(), runs);
  EXPECT_THAT(logOf(b), HasSubstr("is no announcement of a computer; ignored"));
  const std::string status = Computer::read("/proc/" + std::to_string(listener) + "/status");
  const size_t peak = status.find("VmHWM:");
  ASSERT_NE(peak, std::string::npos);
#if defined(__SANITIZE_ADDRESS__)
  const long most = 160L << 10;  // the sanitizer's own memory
#else
  const long most = 40L << 10;
#endif
  EXPECT_LT(std::stol(status.substr(peak + 6)), most) << "kB at most";
}

TEST_F(Push, TheListenerSurvivesARestartOfThePushServerAndCatchesUpOnWhatItMissed) {
  listen();
  Computer::write(a.contacts() + "/ann.vcf", card("ann", "0"));
  syncA();
  ASSERT_TRUE(secondsUntilBHas(card("ann", "0")));

  const size_t listening = occurrences(logOf(b), "Listening for pushes");
  broker.stop();
  ASSERT_TRUE(
      vtc::local::waitUntil([&] { return logOf(b).find("Push listener:") != std::string::npos; }));
  // Announced to nobody: the server is down.
  Computer::write(a.contacts() + "/ann.vcf", card("ann", "1"));
  syncA();
  EXPECT_THAT(logOf(a), HasSubstr("Could not schedule the Beacon Notification session"));

  broker.start();
  ASSERT_TRUE(vtc::local::waitUntil(
      [&] { return occurrences(logOf(b), "Listening for pushes") > listening; }));
  EXPECT_TRUE(secondsUntilBHas(card("ann", "1"))) << "no catch-up after the reconnection";

  Computer::write(a.contacts() + "/ann.vcf", card("ann", "2"));
  syncA();
  std::optional<double> delay = secondsUntilBHas(card("ann", "2"));
  ASSERT_TRUE(delay) << logOf(b);
  EXPECT_LT(*delay, 2.0);
}

TEST_F(Push, StatusShowsScheduleAndPushAndNoPasswordIsInAUnitFileCommandLineOrLogLine) {
  Computer::Result scheduled = a.run({"schedule", "on", "--every", "1h"});
  ASSERT_EQ(scheduled.status, 0) << scheduled.err;
  EXPECT_THAT(scheduled.out, HasSubstr("Scheduled syncs are on: every hour"));
  listen();
  Computer::write(a.contacts() + "/ann.vcf", card("ann", "0"));
  syncA();
  ASSERT_TRUE(secondsUntilBHas(card("ann", "0")));
  const std::string listenerCommandLine =
      Computer::read("/proc/" + std::to_string(listener) + "/cmdline");
  EXPECT_THAT(listenerCommandLine, HasSubstr("listen"));

  Computer::Result statusA = a.run({"status"}), statusB = b.run({"status"});
  EXPECT_THAT(statusA.out, testing::ContainsRegex("Schedule: every hour, next "
                                                  "[0-9]{4}-[0-9]{2}-[0-9]{2} [0-9]{2}:00:00"));
  EXPECT_THAT(statusA.out, HasSubstr("Push: off (" + broker.url() + ")"));
  EXPECT_THAT(statusB.out, HasSubstr("Schedule: off\nPush: on (" + broker.url() + ")"));

  // Everything that holds a command line or is written for others to read.
  std::map<std::string, std::string> texts{{"listener command line", listenerCommandLine}};
  for (const Computer* c : {&a, &b}) {
    for (const char* folder : {"/.config/systemd/user", "/Library/LaunchAgents",
                               "/Library/Logs/Sync", "/.local/share/NubiloSyncClient"}) {
      std::error_code ignored;
      for (const auto& entry : std::filesystem::directory_iterator(c->home() + folder, ignored))
        if (entry.is_regular_file()) texts[entry.path()] = Computer::read(entry.path());
    }
    for (const char* recorded : {"/.systemctl-calls", "/.crontab-calls"})
      if (std::filesystem::exists(c->home() + recorded))
        texts[c->home() + recorded] = Computer::read(c->home() + recorded);
  }
  for (const std::string& needed :
       {a.home() + "/.config/systemd/user/nubilosyncclient.timer",
        b.home() + "/.config/systemd/user/com.korvo.NubiloPushListener.service",
        b.home() + "/.local/share/NubiloSyncClient/PushRegistrations.plist",
        a.home() + "/.systemctl-calls", b.home() + "/.systemctl-calls",
        a.home() + "/Library/Logs/Sync/nubilosync.log",
        b.home() + "/Library/Logs/Sync/nubilosync.log"})
    EXPECT_TRUE(texts.contains(needed)) << needed << " was not looked at";
  EXPECT_THAT(texts[b.home() + "/Library/Logs/Sync/nubilosync.log"],
              HasSubstr("|Info|Running ("));  // the commands the listener ran
  for (const auto& [where, text] : texts)
    EXPECT_THAT(text, testing::Not(HasSubstr(ApacheShare::kPassword))) << where;
}

}  // namespace
