// Real address books and calendars between two computers of one account:
// items known by their UID whatever their file names, written by khard,
// khal, old phones and calendar programs, edited on both computers at the
// grain people edit. Each computer is a home of its own and the client a
// separate process, against a real Apache share.
#include <gmock/gmock.h>

#include <filesystem>
#include <fstream>

#include "localshare/ApacheShare.h"
#include "localshare/Computer.h"
#include "support/TestHome.h"

using testing::HasSubstr;
using testing::Not;
using vtc::local::ApacheShare;
using vtc::local::Computer;

namespace {

std::string edit(std::string bytes, const std::string& from, const std::string& to) {
  const size_t at = bytes.find(from);
  EXPECT_NE(at, std::string::npos) << from;
  if (at != std::string::npos) bytes.replace(at, from.size(), to);
  return bytes;
}

std::string readCorpus(const std::string& name) {
  std::ifstream in(std::string(VSM_TEST_DATA) + "/client/items/corpus/" + name, std::ios::binary);
  return std::string(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
}

class Items : public ::testing::Test {
 protected:
  vtc::test::TestHome home;
  ApacheShare share;
  Computer a{"Mac A"};
  Computer b{"Mac B"};

  void SetUp() override {
    const std::string url = "http://127.0.0.1:" + std::to_string(share.port()) + "/sync";
    a.join(url, ApacheShare::kUser, ApacheShare::kPassword);
    b.join(url, ApacheShare::kUser, ApacheShare::kPassword);
  }
  Computer::Result sync(const Computer& c) {
    Computer::Result r = c.run({"sync", "-v"});
    EXPECT_EQ(r.status, 0) << c.name() << ": " << r.err << r.out;
    return r;
  }
  // Both computers sync until each has taken in the other's changes.
  void syncBoth() {
    sync(a);
    sync(b);
    sync(a);
  }
  // A vdir program run in a computer's home, configured for its folders.
  std::string program(const Computer& c, const std::string& command) {
    const std::string config = c.home() + "/.config";
    std::filesystem::create_directories(config + "/khard");
    std::filesystem::create_directories(config + "/khal");
    std::ofstream(config + "/khard/khard.conf")
        << "[addressbooks]\n[[people]]\npath = " << c.contacts()
        << "\n[general]\neditor = /bin/true\nmerge_editor = /bin/true\n";
    std::ofstream(config + "/khal/config")
        << "[calendars]\n[[home]]\npath = " << c.calendars()
        << "\ntype = calendar\n[locale]\ntimeformat = %H:%M\ndateformat = %Y-%m-%d\n"
           "longdateformat = %Y-%m-%d\ndatetimeformat = %Y-%m-%d %H:%M\n"
           "longdatetimeformat = %Y-%m-%d %H:%M\ndefault_timezone = UTC\nlocal_timezone = UTC\n"
           "[default]\ndefault_calendar = home\n";
    const std::string line = "HOME='" + c.home() + "' XDG_CONFIG_HOME='" + config +
                             "' XDG_DATA_HOME='" + c.home() + "/.local/share' LC_ALL=C.UTF-8 " +
                             command + " 2>&1";
    FILE* pipe = ::popen(line.c_str(), "r");
    std::string out;
    char buffer[4096];
    for (size_t n; pipe && (n = fread(buffer, 1, sizeof buffer, pipe)) > 0;) out.append(buffer, n);
    EXPECT_EQ(pipe ? ::pclose(pipe) : -1, 0) << command << "\n" << out;
    return out;
  }
};

const std::string kAda =
    "BEGIN:VCARD\r\nVERSION:3.0\r\nUID:ada\r\nFN:Ada Lovelace\r\nN:Lovelace;Ada;;;\r\n"
    "TEL;TYPE=cell:+44 111\r\nTEL;TYPE=work:+44 222\r\nTEL;TYPE=home:+44 333\r\n"
    "NOTE:A note long enough that an editor folds it somewhere in the middle of the line.\r\n"
    "END:VCARD\r\n";

TEST_F(Items, EveryKindOfItemCrossesByteForByteAndAnIdleSyncRewritesNothing) {
  // Items that khard and khal write themselves, then items of phones,
  // address books and calendar programs.
  std::filesystem::create_directories(a.home() + "/in");
  Computer::write(a.home() + "/in/new.yaml",
                  "First name : Edsger\nLast name : Dijkstra\n"
                  "Email :\n    work : ewd@example.org\n");
  program(a, "khard new -i '" + a.home() + "/in/new.yaml'");
  program(a, "khal new 2025-03-10 09:00 10:00 'Lecture' :: 'on goto'");
  std::vector<std::string> names;
  for (const auto& entry :
       std::filesystem::directory_iterator(std::string(VSM_TEST_DATA) + "/client/items/corpus")) {
    const std::string name = entry.path().filename();
    Computer::write((name.ends_with(".vcf") ? a.contacts() : a.calendars()) + "/" + name,
                    readCorpus(name));
    names.push_back(name);
  }
  EXPECT_THAT(sync(a).out, Not(HasSubstr("skipped")));
  sync(b);
  EXPECT_EQ(Computer::files(b.contacts()), Computer::files(a.contacts()));
  EXPECT_EQ(Computer::files(b.calendars()), Computer::files(a.calendars()));
  EXPECT_EQ(Computer::files(b.contacts()).size() + Computer::files(b.calendars()).size(),
            names.size() + 2);

  // Nothing to do is nothing done, on either computer.
  std::map<std::string, std::filesystem::file_time_type> before;
  for (const Computer* c : {&a, &b})
    for (const std::string& folder : {c->contacts(), c->calendars()})
      for (const auto& entry : std::filesystem::directory_iterator(folder))
        before[entry.path()] = entry.last_write_time();
  for (const Computer* c : {&a, &b}) EXPECT_THAT(sync(*c).out, HasSubstr("up to date"));
  for (const auto& [path, time] : before)
    EXPECT_EQ(std::filesystem::last_write_time(path), time) << path;

  // The programs read what came in, old formats included. (khard reads a
  // file as UTF-8 before it unfolds it, so it cannot read a card folded
  // inside characters or one in Latin-1, on any computer: those go first.)
  std::filesystem::remove(b.contacts() + "/v40-pid-cjk-emoji.vcf");
  std::filesystem::remove(b.contacts() + "/v21-quoted-printable-latin1.vcf");
  EXPECT_THAT(program(b, "khard --skip-unparsable list"), HasSubstr("Dijkstra"));
  EXPECT_THAT(program(b, "khard --skip-unparsable show uid:v21-john"), HasSubstr("John Doe"));
  EXPECT_THAT(program(b, "khal list 2025-03-10 1d"), HasSubstr("Lecture"));
}

TEST_F(Items, TheSameCardsUnderOtherFileNamesAreOneItemAndARenameTakesAnEditAlong) {
  // Both computers already hold the address book, under other file names.
  Computer::write(a.contacts() + "/ada.vcf", kAda);
  Computer::write(b.contacts() + "/Ada Lovelace.vcf", edit(kAda, "FN:Ada Lovelace", "FN:Ada"));
  const std::string grace =
      "BEGIN:VCARD\r\nVERSION:3.0\r\nUID:grace\r\nFN:Grace Hopper\r\nEND:VCARD\r\n";
  Computer::write(a.contacts() + "/grace.vcf", grace);
  Computer::write(b.contacts() + "/hopper.vcf", grace);
  sync(a);
  Computer::Result joined = sync(b);
  EXPECT_THAT(joined.out, HasSubstr("kept 1 conflict"));
  sync(a);
  // One file per card, named as the share knew it first; the share's FN
  // stands and B keeps its own as a conflict.
  EXPECT_EQ(Computer::files(b.contacts()), Computer::files(a.contacts()));
  EXPECT_THAT(Computer::files(b.contacts()),
              testing::ElementsAre(testing::Key("ada.vcf"), testing::Key("grace.vcf")));
  EXPECT_THAT(b.run({"conflicts"}).out,
              testing::ContainsRegex("\\| lost \\(from Mac B, [^\n]*\n[^\n]*\\| FN:Ada\n"));

  // A renames a file while B edits the card: the edit lands in the renamed file.
  std::filesystem::rename(a.contacts() + "/grace.vcf", a.contacts() + "/Grace Hopper.vcf");
  Computer::write(b.contacts() + "/grace.vcf", edit(grace, "END:VCARD", "NOTE:COBOL\r\nEND:VCARD"));
  syncBoth();
  EXPECT_EQ(Computer::files(b.contacts()), Computer::files(a.contacts()));
  EXPECT_EQ(Computer::read(b.contacts() + "/Grace Hopper.vcf"),
            edit(grace, "END:VCARD", "NOTE:COBOL\r\nEND:VCARD"));

  // Two files of one card in one folder: named, neither sent.
  Computer::write(a.contacts() + "/ada-copy.vcf", edit(kAda, "+44 111", "+44 000"));
  Computer::Result twice = a.run({"sync"});
  EXPECT_EQ(twice.status, 9) << twice.err;
  EXPECT_THAT(twice.err, HasSubstr("skipped ada-copy.vcf: it holds the same item (UID ada) as"));
  sync(b);
  EXPECT_THAT(Computer::read(b.contacts() + "/ada.vcf"), HasSubstr("+44 111"));
}

TEST_F(Items, ContactsEditedOnBothComputersKeepEveryEditAtTheGrainPeopleEdit) {
  const std::string cat =
      "BEGIN:VCARD\r\nVERSION:3.0\r\nUID:cat\r\nFN:Cat\r\nTEL:1\r\nTEL:2\r\nEND:VCARD\r\n";
  Computer::write(a.contacts() + "/ada.vcf", kAda);
  Computer::write(a.contacts() + "/cat.vcf", cat);
  syncBoth();
  // A: the second number of Ada, and Cat's note re-folded as khard does.
  Computer::write(a.contacts() + "/ada.vcf", edit(kAda, "+44 222", "+44 999"));
  Computer::write(a.contacts() + "/cat.vcf", cat);
  const std::string refolded =
      edit(kAda, "in the middle of the line.", "in the middle of t\r\n he line.");
  // B: Ada's first number gone and her note really rewritten.
  Computer::write(b.contacts() + "/ada.vcf",
                  edit(edit(kAda, "TEL;TYPE=cell:+44 111\r\n", ""), "A note long", "A new note"));
  sync(b);
  Computer::write(a.contacts() + "/ada.vcf", edit(refolded, "+44 222", "+44 999"));
  Computer::Result merged = sync(a);
  EXPECT_THAT(merged.out, Not(HasSubstr("conflict")));
  sync(b);
  const std::string both =
      edit(edit(edit(kAda, "+44 222", "+44 999"), "TEL;TYPE=cell:+44 111\r\n", ""), "A note long",
           "A new note");
  EXPECT_EQ(Computer::read(b.contacts() + "/ada.vcf"), both);
  EXPECT_EQ(Computer::files(a.contacts()), Computer::files(b.contacts()));
}

const std::string kSeries =
    "BEGIN:VCALENDAR\r\nVERSION:2.0\r\nPRODID:-//Example//EN\r\nBEGIN:VEVENT\r\nUID:s\r\n"
    "DTSTAMP:20250101T000000Z\r\nDTSTART:20250106T100000Z\r\nDTEND:20250106T110000Z\r\n"
    "RRULE:FREQ=WEEKLY;COUNT=10\r\nSUMMARY:Review\r\n"
    "BEGIN:VALARM\r\nACTION:DISPLAY\r\nDESCRIPTION:Soon\r\nTRIGGER:-PT10M\r\nEND:VALARM\r\n"
    "END:VEVENT\r\nBEGIN:VEVENT\r\nUID:s\r\nRECURRENCE-ID:20250120T100000Z\r\n"
    "DTSTAMP:20250101T000000Z\r\nDTSTART:20250120T140000Z\r\nDTEND:20250120T150000Z\r\n"
    "SUMMARY:Review (afternoon)\r\nEND:VEVENT\r\nEND:VCALENDAR\r\n";

// The series under another UID.
std::string renamed(std::string event, const std::string& uid) {
  for (size_t at; (at = event.find("UID:s\r\n")) != std::string::npos;)
    event.replace(at, 7, "UID:" + uid + "\r\n");
  return event;
}

TEST_F(Items, EventsEditedOnBothComputersMergeByExceptionAlarmTimeAndOccurrence) {
  // Five copies of one series, one per case.
  const char* cases[] = {"exdates", "alarms", "times", "moved", "removed"};
  for (const char* uid : cases)
    Computer::write(a.calendars() + "/" + std::string(uid) + ".ics", renamed(kSeries, uid));
  syncBoth();
  auto on = [&](const Computer& c, const char* uid, const std::string& from,
                const std::string& to) {
    const std::string path = c.calendars() + "/" + std::string(uid) + ".ics";
    Computer::write(path, edit(Computer::read(path), from, to));
  };
  const std::string title = "SUMMARY:Review\r\n";
  on(a, "exdates", title, "EXDATE:20250127T100000Z\r\n" + title);
  on(b, "exdates", title, "EXDATE:20250203T100000Z\r\n" + title);
  const std::string alarmEnd = "END:VALARM\r\n";
  on(a, "alarms", alarmEnd,
     alarmEnd +
         "BEGIN:VALARM\r\nACTION:DISPLAY\r\nDESCRIPTION:A\r\n"
         "TRIGGER:-PT30M\r\nEND:VALARM\r\n");
  on(b, "alarms", alarmEnd,
     alarmEnd +
         "BEGIN:VALARM\r\nACTION:DISPLAY\r\nDESCRIPTION:B\r\n"
         "TRIGGER:-PT60M\r\nEND:VALARM\r\n");
  on(a, "times", "DTSTART:20250106T100000Z", "DTSTART:20250106T120000Z");
  on(a, "times", "DTEND:20250106T110000Z", "DTEND:20250106T130000Z");
  on(b, "times", "DTEND:20250106T110000Z", "DTEND:20250106T103000Z");
  // The series moved on B, one more occurrence moved on A.
  on(b, "moved", "DTSTART:20250106T100000Z", "DTSTART:20250106T090000Z");
  on(b, "moved", "DTEND:20250106T110000Z", "DTEND:20250106T100000Z");
  on(a, "moved", "END:VEVENT\r\nEND:VCALENDAR",
     "END:VEVENT\r\nBEGIN:VEVENT\r\nUID:moved\r\nRECURRENCE-ID:20250203T100000Z\r\n"
     "DTSTAMP:20250101T000000Z\r\nDTSTART:20250203T160000Z\r\nDTEND:20250203T170000Z\r\n"
     "SUMMARY:Review (late)\r\nEND:VEVENT\r\nEND:VCALENDAR");
  // The afternoon occurrence removed on A, renamed on B.
  on(a, "removed",
     "BEGIN:VEVENT\r\nUID:removed\r\nRECURRENCE-ID:20250120T100000Z\r\nDTSTAMP:20250101T000000Z\r\n"
     "DTSTART:20250120T140000Z\r\nDTEND:20250120T150000Z\r\nSUMMARY:Review (afternoon)\r\n"
     "END:VEVENT\r\n",
     "");
  on(b, "removed", "Review (afternoon)", "Review (with guests)");

  sync(b);
  Computer::Result merged = sync(a);
  sync(b);
  sync(a);
  EXPECT_EQ(Computer::files(a.calendars()), Computer::files(b.calendars()));
  auto event = [&](const char* uid) {
    return Computer::read(a.calendars() + "/" + std::string(uid) + ".ics");
  };
  EXPECT_THAT(event("exdates"), HasSubstr("EXDATE:20250127T100000Z"));
  EXPECT_THAT(event("exdates"), HasSubstr("EXDATE:20250203T100000Z"));
  EXPECT_THAT(event("alarms"), HasSubstr("TRIGGER:-PT30M"));
  EXPECT_THAT(event("alarms"), HasSubstr("TRIGGER:-PT60M"));
  // B's times reached the share first and stand together.
  EXPECT_THAT(event("times"), HasSubstr("DTSTART:20250106T100000Z\r\nDTEND:20250106T103000Z"));
  // The series moved first: A's occurrence goes, kept as a conflict.
  EXPECT_THAT(event("moved"), HasSubstr("DTSTART:20250106T090000Z"));
  EXPECT_THAT(event("moved"), Not(HasSubstr("Review (late)")));
  // The occurrence edited on B comes back on A, which had removed it.
  EXPECT_THAT(event("removed"), HasSubstr("Review (with guests)"));
  const std::string conflicts = a.run({"conflicts"}).out;
  EXPECT_THAT(conflicts, HasSubstr("the occurrence of 20250203T100000Z  (moved.ics, "));
  EXPECT_THAT(conflicts, HasSubstr(": DTSTART  (times.ics, "));
  EXPECT_THAT(conflicts, HasSubstr("the occurrence of 20250120T100000Z  (removed.ics, "));
  EXPECT_THAT(merged.out, HasSubstr("kept"));
  // And both go on syncing.
  on(b, "removed", "Review (with guests)", "Review (with everyone)");
  syncBoth();
  EXPECT_THAT(event("removed"), HasSubstr("Review (with everyone)"));
}

}  // namespace
