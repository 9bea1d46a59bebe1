// The README's user's guide, run as written: its commands are taken from
// the guide's shell blocks in order and run on two computers against a
// share and a push server of the test's own, with the example address and
// push server replaced by theirs and a password command added to setup
// (the guide's setup asks at a terminal). Lines that are not the client
// (building, installing) are the test's own business and are left out.
#include <gmock/gmock.h>
#include <sys/stat.h>

#include <filesystem>
#include <fstream>
#include <sstream>

#include "localshare/ApacheShare.h"
#include "localshare/Computer.h"
#include "support/MqttBroker.h"
#include "support/TestHome.h"

using vtc::local::ApacheShare;
using vtc::local::Computer;

namespace {

struct GuideStep {
  std::string on;  // "first", "second" or "both"
  std::vector<std::string> args;
  std::string line;
};

// Words as a shell splits them, for the quoting the guide uses.
std::vector<std::string> words(const std::string& line) {
  std::vector<std::string> out;
  std::string word;
  bool inWord = false;
  char quote = 0;
  for (char c : line) {
    if (quote) {
      if (c == quote)
        quote = 0;
      else
        word += c;
    } else if (c == '"' || c == '\'') {
      quote = c;
      inWord = true;
    } else if (c == '#' && !inWord) {
      break;  // a comment
    } else if (c == ' ' || c == '\t') {
      if (inWord) out.push_back(word);
      word.clear();
      inWord = false;
    } else {
      word += c;
      inWord = true;
    }
  }
  if (inWord) out.push_back(word);
  return out;
}

std::vector<GuideStep> guideSteps(const std::string& readme) {
  std::ifstream in(readme);
  std::vector<GuideStep> steps;
  bool inGuide = false, inBlock = false;
  std::string on = "first";
  for (std::string line; std::getline(in, line);) {
    if (line.starts_with("## ")) inGuide = line == "## User's guide";
    if (!inGuide) continue;
    if (line.starts_with("```")) {
      inBlock = line == "```sh";
      continue;
    }
    if (!inBlock) continue;
    if (line.starts_with("# on the first computer")) on = "first";
    if (line.starts_with("# on the second computer")) on = "second";
    if (line.starts_with("# on both computers")) on = "both";
    if (!line.starts_with("nubilosyncclient ")) continue;
    std::vector<std::string> args = words(line);
    args.erase(args.begin());
    steps.push_back({on, args, line});
  }
  return steps;
}

TEST(Guide, TheUsersGuideRunsAsWrittenOnTwoComputers) {
  vtc::test::TestHome home;
  ApacheShare share;
  vtc::test::MqttBroker broker;
  const std::string url = "http://127.0.0.1:" + std::to_string(share.port()) + "/sync";
  Computer first{"laptop"}, second{"desktop"};
  // A user manager that takes every request.
  const std::string stubs = home.path() + "/stand-ins";
  std::filesystem::create_directories(stubs);
  Computer::write(stubs + "/systemctl", "#!/bin/sh\nexit 0\n");
  ::chmod((stubs + "/systemctl").c_str(), 0755);
  for (Computer* c : {&first, &second}) {
    c->setEnvironment("PATH", stubs + ":" + std::getenv("PATH"));
    Computer::write(c->home() + "/.password", std::string(ApacheShare::kPassword) + "\n");
  }

  const std::vector<GuideStep> steps = guideSteps(std::string(VSM_TEST_DATA) + "/../README.md");
  ASSERT_GE(steps.size(), 15u) << "the guide's commands were not found";
  std::set<std::string> commands;
  for (const GuideStep& step : steps) {
    for (Computer* c : {&first, &second}) {
      if (step.on != "both" && (step.on == "first") != (c == &first)) continue;
      std::vector<std::string> args;
      for (const std::string& a : step.args)
        args.push_back(a == "https://dav.example.org/sync" ? url
                       : a == "mqtts://push.example.org"   ? broker.url()
                                                           : a);
      if (args.front() == "setup")
        for (const char* more : {"--password-command", "", "--allow-insecure"})
          args.push_back(*more ? more : "cat '" + c->home() + "/.password'");
      Computer::Result r = c->run(args);
      EXPECT_EQ(r.status, 0) << c->name() << ": " << step.line << "\n" << r.err << r.out;
      commands.insert(args.front());
    }
    // What the guide's first sync sets up: an item to carry.
    if (step.args ==
            std::vector<std::string>{"add", "contacts", "~/.local/share/contacts/people"} &&
        step.on == "first")
      Computer::write(first.home() + "/.local/share/contacts/people/ann.vcf",
                      "BEGIN:VCARD\r\nVERSION:3.0\r\nUID:ann\r\nFN:Ann\r\nEND:VCARD\r\n");
  }
  // The guide covers what a user does.
  for (const char* needed : {"setup", "add", "sync", "status", "schedule", "push", "conflicts",
                             "repair", "remove", "--version"})
    EXPECT_TRUE(commands.contains(needed)) << needed;
  EXPECT_EQ(Computer::files(second.home() + "/.local/share/contacts/people").size(), 1u);
}

}  // namespace
