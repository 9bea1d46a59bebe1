// The vdir store between real vdir programs: a field edited with the
// program on this computer and a field changed on another computer both
// end up in the file, and the program still reads it.
#include <gtest/gtest.h>

#include <cstdio>
#include <filesystem>
#include <fstream>

#include "client/items/ItemRecord.h"
#include "client/merge/RecordMerge.h"
#include "client/stores/VdirCollection.h"
#include "support/TestHome.h"

namespace {

using vtc::Dictionary;
using vtc::Value;
using vtc::client::ItemKind;
using vtc::client::recordOfBytes;
using vtc::client::renderRecord;
using vtc::client::VdirCollection;
using vtc::client::WriteOutcome;

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

  // An item new to the folder, as the sync writes one from another
  // computer's record; the record it was synced as.
  Dictionary addItem(VdirCollection& store, const std::string& name, const std::string& bytes) {
    std::optional<Dictionary> record = recordOfBytes(store.kind(), bytes, name);
    EXPECT_TRUE(record);
    std::optional<std::string> rendered = renderRecord(record.value_or(Dictionary{}));
    EXPECT_EQ(rendered, bytes);
    EXPECT_EQ(store.write(name, bytes, std::nullopt, nullptr), WriteOutcome::Written);
    return record.value_or(Dictionary{});
  }

  // The program's edit here merged with another computer's version of the
  // item, written over the file as the sync writes it.
  void mergeTheirs(VdirCollection& store, const std::string& name, const Dictionary& base,
                   const Dictionary& theirs) {
    std::optional<std::string> now = store.read(name);
    ASSERT_TRUE(now);
    std::optional<Dictionary> ours = recordOfBytes(store.kind(), *now, name, &base);
    ASSERT_TRUE(ours) << *now;
    ASSERT_FALSE(*ours == base) << "the program's edit is not seen";
    vtc::client::merge::Merged merged =
        vtc::client::merge::mergeRecord(store.kind(), base, ours, theirs);
    ASSERT_TRUE(merged.record);
    for (const auto& lost : merged.lost)
      ADD_FAILURE() << "lost " << lost.key << ": " << lost.lost.description() << " for "
                    << lost.kept.description() << "\nours: " << *now;
    std::optional<std::string> bytes = renderRecord(*merged.record, &*ours);
    ASSERT_TRUE(bytes);
    EXPECT_EQ(store.write(name, *bytes, store.stat(name), nullptr), WriteOutcome::Written);
  }
};

TEST_F(VdirPrograms, KhardReadsAContactWithItsOwnEditAndOneFromAnotherComputer) {
  writeFile(home.path() + "/.config/khard/khard.conf",
            "[addressbooks]\n[[friends]]\npath = " + folder +
                "\n[general]\neditor = /bin/true\nmerge_editor = /bin/true\n");
  VdirCollection store(folder, ItemKind::Contacts);
  const Dictionary base = addItem(store, "ada.vcf",
                                  "BEGIN:VCARD\r\nVERSION:3.0\r\nUID:ada\r\nFN:Ada Lovelace\r\n"
                                  "N:Lovelace;Ada;;;\r\nEMAIL;TYPE=home:ada@example.org\r\n"
                                  "X-PLANNER;X-ROLE=\"a:b\":kept by everyone\r\nEND:VCARD\r\n");

  // Here: the e-mail address, edited with khard.
  writeFile(home.path() + "/edit.yaml",
            "First name : Ada\nLast name : Lovelace\nEmail :\n    work : ada@work.example\n");
  run("echo y | khard edit -i '" + home.path() + "/edit.yaml' uid:ada");

  // Elsewhere: a phone number, and a long note folded the way its writer
  // folded it.
  std::string note = "Zürich–Genève über Brücken!!!!";
  for (int i = 0; i < 4; ++i) note += " – Ärger über Öl für Ölgemälde 🎨";
  size_t cut = 68;
  while ((static_cast<unsigned char>(note[cut]) & 0xC0) == 0x80) --cut;
  const std::string folded = "NOTE:" + note.substr(0, cut) + "\r\n " + note.substr(cut) + "\r\n";
  Dictionary theirs = base;
  theirs.set("NOTE", Value(folded));
  theirs.set("TEL#00000001", Value("TEL;TYPE=cell:+44 7700 900123\r\n"));
  mergeTheirs(store, "ada.vcf", base, theirs);

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
  const Dictionary base = addItem(store, "standup@example.org.ics", event);

  // Here: the series renamed, by importing it again into khal.
  std::string renamed = event;
  renamed.replace(renamed.find("SUMMARY:Stand-up\r\n"), 18, "SUMMARY:Daily stand-up\r\n");
  writeFile(home.path() + "/renamed.ics", renamed);
  run("khal import --batch -a work '" + home.path() + "/renamed.ics'");

  // Elsewhere: a room for the series, and the moved occurrence's title.
  const std::string master = "VEVENT//standup@example.org/";
  const std::string moved = "VEVENT/20250311T090000Z/standup@example.org/";
  Dictionary theirs = base;
  theirs.set(master + "LOCATION", Value("LOCATION:Room Süd\r\n"));
  theirs.set(moved + "SUMMARY", Value("SUMMARY:Stand-up in the garden\r\n"));
  mergeTheirs(store, "standup@example.org.ics", base, theirs);

  EXPECT_EQ(run("khal list -f '{start-time} {title} @{location}' 2025-03-10 3d"),
            "Monday, 2025-03-10\n09:00 Daily stand-up @Room Süd\n"
            "Tuesday, 2025-03-11\n13:00 Stand-up in the garden @\n"
            "Wednesday, 2025-03-12\n09:00 Daily stand-up @Room Süd\n");
}

}  // namespace
