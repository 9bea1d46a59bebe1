// The vdir store between real vdir programs: a field edited with the
// program on this computer and a field changed on another computer both
// end up in the file, and the program still reads it.
#include <gtest/gtest.h>

#include <cstdio>
#include <filesystem>
#include <fstream>

#include "FieldChanges.h"
#include "client/stores/VdirCollection.h"
#include "support/TestHome.h"

namespace {

using vtc::Array;
using vtc::Dictionary;
using vtc::client::applyFieldChanges;
using vtc::client::ItemKind;
using vtc::client::ItemState;
using vtc::client::ScanResult;
using vtc::client::splitItem;
using vtc::client::VdirCollection;
using vtc::client::WriteOutcome;
using vtc::test::setField;

class VdirPrograms : public ::testing::Test {
 protected:
  vtc::test::TestHome home;
  std::string folder = home.path() + "/vdir";

  void SetUp() override { std::filesystem::create_directories(folder); }

  void writeFile(const std::string& path, const std::string& text) {
    std::filesystem::create_directories(std::filesystem::path(path).parent_path());
    std::ofstream(path, std::ios::binary) << text;
  }

  // Runs a command line with this home's configuration; its output, both streams.
  std::string run(const std::string& command) {
    std::string line = "HOME='" + home.path() + "' XDG_CONFIG_HOME='" + home.path() +
                       "/.config' XDG_DATA_HOME='" + home.path() +
                       "/.local/share' LC_ALL=C.UTF-8 " + command + " 2>&1";
    FILE* pipe = ::popen(line.c_str(), "r");
    EXPECT_NE(pipe, nullptr);
    std::string out;
    char buffer[4096];
    for (size_t n; pipe && (n = fread(buffer, 1, sizeof buffer, pipe)) > 0;) out.append(buffer, n);
    int status = pipe ? ::pclose(pipe) : -1;
    EXPECT_EQ(status, 0) << command << "\n" << out;
    return out;
  }

  // Writes an item new to the folder, the way the sync adds one from the
  // other computer's fields.
  ItemState addItem(VdirCollection& store, const std::string& name, const std::string& example) {
    std::optional<Dictionary> fields = splitItem(store.kind(), example);
    EXPECT_TRUE(fields);
    std::string bytes = applyFieldChanges(store.kind(), std::nullopt,
                                          vtc::test::setsOf(fields.value_or(Dictionary{})));
    ItemState state;
    EXPECT_EQ(store.write(name, bytes, std::nullopt, &state), WriteOutcome::Written);
    return state;
  }

  // Applies another computer's changes over a local edit the scan found.
  void applyRemoteChanges(VdirCollection& store, const std::string& name, const ItemState& known,
                          const Array& changes) {
    ScanResult scan = store.scan({{name, known}});
    ASSERT_EQ(scan.changed.size(), 1u) << "the program's edit is not seen";
    std::string bytes = applyFieldChanges(store.kind(), store.read(name), changes);
    EXPECT_EQ(store.write(name, bytes, scan.states.at(name), nullptr), WriteOutcome::Written);
  }
};

TEST_F(VdirPrograms, KhardReadsAContactWithItsOwnEditAndOneFromAnotherComputer) {
  writeFile(home.path() + "/.config/khard/khard.conf",
            "[addressbooks]\n[[friends]]\npath = " + folder +
                "\n[general]\neditor = /bin/true\nmerge_editor = /bin/true\n");
  VdirCollection store(folder, ItemKind::Contacts);
  ItemState known = addItem(store, "ada.vcf",
                            "BEGIN:VCARD\r\nVERSION:3.0\r\nUID:ada\r\nFN:Ada Lovelace\r\n"
                            "N:Lovelace;Ada;;;\r\nEMAIL;TYPE=home:ada@example.org\r\n"
                            "X-PLANNER;X-ROLE=\"a:b\":kept by everyone\r\nEND:VCARD\r\n");

  // Here: the e-mail address, edited with khard.
  writeFile(home.path() + "/edit.yaml",
            "First name : Ada\nLast name : Lovelace\nEmail :\n    work : ada@work.example\n");
  run("echo y | khard edit -i '" + home.path() + "/edit.yaml' uid:ada");

  // Elsewhere: a phone number, and a note whose 75th octet falls inside a
  // character, which khard cannot read if the fold goes there.
  std::string note = "Zürich–Genève über Brücken!!!!";
  for (int i = 0; i < 4; ++i) note += " – Ärger über Öl für Ölgemälde 🎨";
  applyRemoteChanges(store, "ada.vcf", known,
                     Array{setField("NOTE", "NOTE:" + note + "\r\n"),
                           setField("TEL", "TEL;TYPE=cell:+44 7700 900123\r\n")});

  std::string shown = run("khard show uid:ada");
  EXPECT_NE(shown.find("ada@work.example"), std::string::npos) << shown;
  EXPECT_NE(shown.find("Note: " + note + "\n"), std::string::npos) << shown;
  EXPECT_NE(shown.find("+44 7700 900123"), std::string::npos) << shown;
  EXPECT_NE(store.read("ada.vcf")->find("X-PLANNER;X-ROLE=\"a:b\":kept by everyone\r\n"),
            std::string::npos);
}

TEST_F(VdirPrograms, KhalListsAnEventWithItsOwnEditAndOnesFromAnotherComputer) {
  writeFile(home.path() + "/.config/khal/config",
            "[calendars]\n[[work]]\npath = " + folder +
                "\ntype = calendar\n[locale]\ntimeformat = %H:%M\ndateformat = %Y-%m-%d\n"
                "longdateformat = %Y-%m-%d\ndatetimeformat = %Y-%m-%d %H:%M\n"
                "longdatetimeformat = %Y-%m-%d %H:%M\ndefault_timezone = UTC\n"
                "local_timezone = UTC\n[default]\ndefault_calendar = work\n");
  VdirCollection store(folder, ItemKind::Calendars);
  const std::string event =
      "BEGIN:VCALENDAR\r\nVERSION:2.0\r\nPRODID:-//Example//Planner//EN\r\n"
      "BEGIN:VEVENT\r\nUID:standup@example.org\r\nDTSTAMP:20250101T000000Z\r\n"
      "DTSTART:20250310T090000Z\r\nDTEND:20250310T091500Z\r\nRRULE:FREQ=DAILY;COUNT=3\r\n"
      "SUMMARY:Stand-up\r\nBEGIN:VALARM\r\nACTION:DISPLAY\r\nDESCRIPTION:Soon\r\n"
      "TRIGGER:-PT10M\r\nEND:VALARM\r\nEND:VEVENT\r\n"
      "BEGIN:VEVENT\r\nUID:standup@example.org\r\nRECURRENCE-ID:20250311T090000Z\r\n"
      "DTSTAMP:20250101T000000Z\r\nDTSTART:20250311T130000Z\r\nDTEND:20250311T131500Z\r\n"
      "SUMMARY:Stand-up after lunch\r\nEND:VEVENT\r\nEND:VCALENDAR\r\n";
  ItemState known = addItem(store, "standup@example.org.ics", event);

  // Here: the series renamed, by importing it again into khal.
  std::string renamed = event;
  renamed.replace(renamed.find("SUMMARY:Stand-up\r\n"), 18, "SUMMARY:Daily stand-up\r\n");
  writeFile(home.path() + "/renamed.ics", renamed);
  run("khal import --batch -a work '" + home.path() + "/renamed.ics'");

  // Elsewhere: a room for the series, and the moved occurrence's title.
  const std::string master = "VEVENT/standup@example.org/";
  applyRemoteChanges(
      store, "standup@example.org.ics", known,
      Array{setField(master + "LOCATION", "LOCATION:Room Süd\r\n"),
            setField(master + "20250311T090000Z/SUMMARY", "SUMMARY:Stand-up in the garden\r\n")});

  EXPECT_EQ(run("khal list -f '{start-time} {title} @{location}' 2025-03-10 3d"),
            "Monday, 2025-03-10\n09:00 Daily stand-up @Room Süd\n"
            "Tuesday, 2025-03-11\n13:00 Stand-up in the garden @\n"
            "Wednesday, 2025-03-12\n09:00 Daily stand-up @Room Süd\n");
}

}  // namespace
