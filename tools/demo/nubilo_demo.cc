// The demonstration: a private WebDAV share on 127.0.0.1 and two computers
// of one account (two homes), each with a vdir address book and calendar.
// Every step is a nubilosyncclient command as a person would type it, shown
// with its output; at the end both computers hold the same folders.
#include <cstdio>
#include <cstdlib>
#include <exception>
#include <string>
#include <vector>

#include "localshare/ApacheShare.h"
#include "localshare/Computer.h"
#include "platform/fs/LocalPaths.h"

using vtc::local::ApacheShare;
using vtc::local::Computer;

namespace {

std::string card(const std::string& uid, const std::string& fn, const std::string& email,
                 const std::string& tel) {
  return "BEGIN:VCARD\r\nVERSION:3.0\r\nUID:" + uid + "\r\nFN:" + fn + "\r\nN:" + fn +
         ";;;;\r\nEMAIL;TYPE=home:" + email + "\r\nTEL;TYPE=cell:" + tel + "\r\nEND:VCARD\r\n";
}

std::string event(const std::string& uid, const std::string& start, const std::string& summary) {
  return "BEGIN:VCALENDAR\r\nVERSION:2.0\r\nPRODID:-//Demo//Planner//EN\r\nBEGIN:VEVENT\r\nUID:" +
         uid + "\r\nDTSTAMP:20260101T000000Z\r\nDTSTART:" + start +
         "\r\nDTEND:" + start.substr(0, 9) + "235900Z\r\nSUMMARY:" + summary +
         "\r\nEND:VEVENT\r\nEND:VCALENDAR\r\n";
}

void say(const std::string& text) {
  std::printf("\n== %s\n", text.c_str());
}

// Runs a command on a computer and shows it with its output.
void type(const Computer& c, const std::vector<std::string>& args) {
  std::string line = c.name() + "$ nubilosyncclient";
  for (const std::string& a : args)
    line += " " + (a.find(' ') == std::string::npos ? a : "'" + a + "'");
  std::printf("%s\n", line.c_str());
  Computer::Result r = c.run(args);
  if (!r.out.empty()) std::printf("%s", r.out.c_str());
  if (!r.err.empty()) std::printf("%s", r.err.c_str());
  if (r.status != 0)
    throw std::runtime_error("the command failed with status " + std::to_string(r.status));
}

void write(const Computer& c, const std::string& path, const std::string& content,
           const std::string& what) {
  std::printf("%s: %s\n", c.name().c_str(), what.c_str());
  Computer::write(path, content);
}

}  // namespace

int main() {
  try {
    // The demo's own home: its preferences and log stay out of the user's.
    std::string home = vtc::paths::join(vtc::paths::temporaryDirectory(), "nubilo-demo-XXXXXX");
    ::setenv("HOME", ::mkdtemp(home.data()), 1);
    ApacheShare share;
    const std::string url = "http://127.0.0.1:" + std::to_string(share.port()) + "/nubilo";
    std::printf("A WebDAV share runs at %s (user %s).\n", url.c_str(), ApacheShare::kUser);
    Computer laptop("laptop"), desktop("desktop");

    say("Both computers join the account and name their folders");
    for (const Computer* c : {&laptop, &desktop}) {
      // Plain HTTP on loopback: the password crosses no network.
      type(*c, {"setup", url, "--user", ApacheShare::kUser, "--password-command",
                std::string("printf ") + ApacheShare::kPassword, "--allow-insecure"});
      type(*c, {"add", "contacts", c->contacts()});
      type(*c, {"add", "calendars", c->calendars()});
    }

    say("The laptop has an address book and a calendar; the desktop a contact of its own");
    write(laptop, laptop.contacts() + "/ada.vcf",
          card("ada", "Ada Lovelace", "ada@example.org", "+44 20 7946 0001"), "adds Ada");
    write(laptop, laptop.contacts() + "/alan.vcf",
          card("alan", "Alan Turing", "alan@example.org", "+44 20 7946 0002"), "adds Alan");
    write(laptop, laptop.calendars() + "/lecture.ics",
          event("lecture", "20261203T090000Z", "Lecture on engines"), "adds a lecture");
    write(desktop, desktop.contacts() + "/grace.vcf",
          card("grace", "Grace Hopper", "grace@example.org", "+1 202 555 0103"), "adds Grace");
    type(laptop, {"sync"});
    type(desktop, {"sync"});
    type(laptop, {"sync"});

    say("Edits of different fields on each side both survive");
    write(laptop, laptop.contacts() + "/ada.vcf",
          card("ada", "Ada Lovelace", "ada@example.org", "+44 20 7946 0999"),
          "changes Ada's phone");
    write(desktop, desktop.contacts() + "/ada.vcf",
          card("ada", "Ada Lovelace", "countess@example.org", "+44 20 7946 0001"),
          "changes Ada's e-mail");
    say("And both rename Alan: a conflict");
    write(laptop, laptop.contacts() + "/alan.vcf",
          card("alan", "Alan M. Turing", "alan@example.org", "+44 20 7946 0002"),
          "renames Alan to Alan M. Turing");
    write(desktop, desktop.contacts() + "/alan.vcf",
          card("alan", "A. M. Turing", "alan@example.org", "+44 20 7946 0002"),
          "renames Alan to A. M. Turing");
    type(laptop, {"sync"});
    type(desktop, {"sync"});
    type(laptop, {"sync"});
    type(desktop, {"conflicts"});

    say("Where things stand");
    type(desktop, {"status"});

    say("Both computers now hold the same folders");
    bool same = true;
    for (auto folder : {&Computer::contacts, &Computer::calendars}) {
      auto left = Computer::files((laptop.*folder)());
      auto right = Computer::files((desktop.*folder)());
      same = same && left == right;
      for (const auto& [name, content] : left)
        std::printf("  %s (%zu bytes)\n", name.c_str(), content.size());
    }
    std::printf("%s\n",
                same ? "The laptop's and the desktop's folders are equal." : "The folders differ!");
    std::printf("\nAda on both computers:\n%s",
                Computer::read(laptop.contacts() + "/ada.vcf").c_str());
    return same ? 0 : 1;
  } catch (const std::exception& e) {
    std::fprintf(stderr, "demo failed: %s\n", e.what());
    return 1;
  }
}
