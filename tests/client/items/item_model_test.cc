// Items as records: the corpus of real-world items read and written back
// byte for byte, values compared by what they mean, instances that keep
// their keys across edits, bytes in other character sets kept as they are,
// and the checks every merged item passes before it is written.
#include <gmock/gmock.h>

#include <filesystem>
#include <fstream>

#include "client/items/ItemCheck.h"
#include "client/items/ItemRecord.h"
#include "client/items/Meaning.h"
#include "platform/plist/PlistCodec.h"

namespace {

using testing::ElementsAre;
using vtc::Dictionary;
using vtc::Value;
using vtc::client::ItemKind;
using vtc::client::recordOfBytes;
using vtc::client::renderRecord;
using vtc::client::sameMeaning;

std::string readFile(const std::filesystem::path& path) {
  std::ifstream in(path, std::ios::binary);
  return std::string(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
}

ItemKind kindOf(const std::string& name) {
  return name.ends_with(".vcf") ? ItemKind::Contacts : ItemKind::Calendars;
}

Dictionary recordOf(ItemKind kind, const std::string& bytes, const Dictionary* previous = nullptr) {
  std::string problem;
  auto record = recordOfBytes(kind, bytes, "item", previous, &problem);
  EXPECT_TRUE(record) << problem << "\n" << bytes;
  return record.value_or(Dictionary{});
}

// The keys of a record with this property name, in file order.
std::vector<std::string> keysNamed(const Dictionary& record, std::string_view name) {
  std::vector<std::string> keys;
  for (const std::string& key : vtc::client::recordOrder(record))
    if (vtc::client::nameOf(key) == name) keys.push_back(key);
  return keys;
}

// A photo of about 200 KB, base64 folded at 75 octets as 3.0 writers do,
// or as a data URI on one very long line as some 4.0 writers do.
std::string photoCard(bool version4) {
  std::string base64;
  for (int i = 0; base64.size() < 200 * 1024; ++i)
    base64 += "QUJDREVGR0hJSktMTU5PUFFSU1RVVldYWVo" + std::to_string(i % 10);
  std::string line =
      version4 ? "PHOTO:data:image/jpeg;base64," + base64 : "PHOTO;ENCODING=b;TYPE=JPEG:" + base64;
  std::string folded;
  if (version4) {
    folded = line + "\r\n";
  } else {
    for (size_t at = 0; at < line.size(); at += at == 0 ? 75 : 74)
      folded += (at == 0 ? "" : " ") + line.substr(at, at == 0 ? 75 : 74) + "\r\n";
  }
  return std::string("BEGIN:VCARD\r\nVERSION:") + (version4 ? "4.0" : "3.0") +
         "\r\nFN:Photo Person\r\nUID:photo-" + (version4 ? "4" : "3") + "\r\n" + folded +
         "END:VCARD\r\n";
}

TEST(ItemModel, EveryItemOfTheCorpusIsReadAndWrittenBackByteForByte) {
  std::vector<std::pair<std::string, std::string>> items;
  for (const auto& entry :
       std::filesystem::directory_iterator(std::string(VSM_TEST_DATA) + "/client/items/corpus"))
    items.emplace_back(entry.path().filename(), readFile(entry.path()));
  items.emplace_back("photo-3.vcf", photoCard(false));
  items.emplace_back("photo-4.vcf", photoCard(true));
  ASSERT_GE(items.size(), 11u);
  for (const auto& [name, bytes] : items) {
    SCOPED_TRACE(name);
    const ItemKind kind = kindOf(name);
    const Dictionary record = recordOf(kind, bytes);
    EXPECT_EQ(renderRecord(record), bytes);
    EXPECT_THAT(vtc::client::itemProblems(kind, bytes), testing::IsEmpty());
    // Read again against itself, every unit keeps its key.
    EXPECT_EQ(recordOf(kind, bytes, &record), record);
    // Through a changelog's encoding and back, bytes and all.
    EXPECT_EQ(vtc::plist::parse(vtc::plist::toBinary(Value(record))), Value(record));
  }
}

TEST(ItemModel, ItemsAreKnownByTheirUidAndOnlyWithoutOneByTheirFileName) {
  auto identity = [](ItemKind kind, const std::string& bytes, const std::string& file) {
    auto text = vtc::client::readItemText(kind, bytes);
    EXPECT_TRUE(text);
    return text ? vtc::client::recordIdentity(*text, file) : std::string();
  };
  const std::string corpus = std::string(VSM_TEST_DATA) + "/client/items/corpus/";
  EXPECT_EQ(identity(ItemKind::Contacts, readFile(corpus + "v21-agent.vcf"), "a.vcf"), "v21-john");
  EXPECT_EQ(identity(ItemKind::Calendars, readFile(corpus + "tz-rrule-exdate-override.ics"), "x"),
            "weekly-review@example.org");
  EXPECT_EQ(identity(ItemKind::Calendars, readFile(corpus + "no-uid-lf.ics"), "dentist.ics"),
            "file:dentist.ics");
  // The agent's own card is part of the agent, not a second card.
  const Dictionary agent = recordOf(ItemKind::Contacts, readFile(corpus + "v21-agent.vcf"));
  EXPECT_THAT(keysNamed(agent, "TEL"), testing::SizeIs(1));
  EXPECT_THAT(keysNamed(agent, "AGENT"), testing::SizeIs(1));
}

TEST(ItemModel, ValuesCompareByWhatTheyMean) {
  auto same = [](const std::string& a, const std::string& b) {
    return sameMeaning(Value(a), Value(b));
  };
  // Folding anywhere, inside a character too, line ends and blank lines.
  EXPECT_TRUE(same("NOTE:Grüße aus Zürich\r\n",
                   "NOTE:Gr\xC3\r\n \xBC\xC3\x9F"
                   "e aus Z\r\n ürich\n"));
  EXPECT_TRUE(same("\r\nFN:Ada\r\n", "FN:Ada\n"));
  // Names, parameter names, parameter order, types written either way.
  EXPECT_TRUE(same("tel;type=work;pref=1:+1 555\r\n", "TEL;PREF=1;TYPE=WORK:+1 555\r\n"));
  EXPECT_TRUE(same("TEL;WORK;VOICE:+1 555\r\n", "TEL;TYPE=voice,work:+1 555\r\n"));
  EXPECT_TRUE(same("DTSTART;VALUE=DATE-TIME:20250310T090000Z\n", "DTSTART:20250310T090000Z\r\n"));
  // Quoted-printable with soft breaks, and a charset other than UTF-8.
  EXPECT_TRUE(same("NOTE;ENCODING=QUOTED-PRINTABLE;CHARSET=UTF-8:Gr=C3=BC=\r\n=C3=9Fe\r\n",
                   "NOTE:Grüße\r\n"));
  EXPECT_TRUE(same("N;CHARSET=ISO-8859-1:M\xFCller;J\xFCrgen\r\n", "N:Müller;Jürgen\r\n"));
  // What a reader sees as different is different.
  EXPECT_FALSE(same("TEL:1\r\n", "TEL:2\r\n"));
  EXPECT_FALSE(same("NOTE:a\\,b\r\n", "NOTE:a,b\r\n"));
  EXPECT_FALSE(same("TEL;TYPE=work:1\r\n", "TEL;TYPE=home:1\r\n"));
  EXPECT_FALSE(same("SUMMARY:Stand-up\r\n", "SUMMARY:stand-up\r\n"));
}

TEST(ItemModel, BytesThatAreNotUtf8TravelAsDataAndComeBackUnchanged) {
  const std::string latin1 =
      "BEGIN:VCARD\r\nVERSION:2.1\r\nN;CHARSET=ISO-8859-1:M\xFCller\r\n"
      "FN;CHARSET=ISO-8859-1:J\xFCrgen M\xFCller\r\nEND:VCARD\r\n";
  const Dictionary record = recordOf(ItemKind::Contacts, latin1);
  EXPECT_EQ(record.get("N").kind(), Value::Kind::Data);
  EXPECT_TRUE(record.get("VERSION").isString());
  auto back = vtc::plist::parse(vtc::plist::toBinary(Value(record)));
  ASSERT_TRUE(back);
  EXPECT_EQ(renderRecord(back->dictionary()), latin1);
}

TEST(ItemModel, AnInstanceKeepsItsKeyAcrossEditsAndANewOneGetsAKeyFromWhatItHolds) {
  const std::string card =
      "BEGIN:VCARD\r\nVERSION:3.0\r\nFN:Ada\r\nUID:ada\r\nTEL;TYPE=cell:+1 111\r\n"
      "TEL;TYPE=work:+1 222\r\nTEL;TYPE=home:+1 333\r\nEND:VCARD\r\n";
  const Dictionary base = recordOf(ItemKind::Contacts, card);
  const std::vector<std::string> tels = keysNamed(base, "TEL");
  ASSERT_EQ(tels.size(), 3u);
  auto edited = [&](const std::string& from, const std::string& to) {
    std::string bytes = card;
    bytes.replace(bytes.find(from), from.size(), to);
    return keysNamed(recordOf(ItemKind::Contacts, bytes, &base), "TEL");
  };
  // The second number's value, or its type alone, edited: the same instance.
  EXPECT_EQ(edited("+1 222", "+1 999"), tels);
  EXPECT_EQ(edited("TYPE=work", "TYPE=main"), tels);
  // The first one removed: the others keep theirs.
  EXPECT_THAT(edited("TEL;TYPE=cell:+1 111\r\n", ""), ElementsAre(tels[1], tels[2]));
  // A new one, made the same on two computers that never met, has one key.
  const std::string added = "TEL;TYPE=fax:+1 444\r\nEND:VCARD";
  auto here = edited("END:VCARD", added);
  auto there = keysNamed(recordOf(ItemKind::Contacts,
                                  [&] {
                                    std::string b = card;
                                    return b.replace(b.find("END:VCARD"), 9, added);
                                  }()),
                         "TEL");
  ASSERT_EQ(here.size(), 4u);
  EXPECT_EQ(here[3], there[3]);

  // An attendee is its address: a changed reply keeps it; a vCard 4.0
  // instance is its PID.
  const std::string event =
      "BEGIN:VCALENDAR\r\nVERSION:2.0\r\nBEGIN:VEVENT\r\nUID:e\r\nDTSTART:20250101T100000Z\r\n"
      "ATTENDEE;PARTSTAT=NEEDS-ACTION:mailto:ada@example.org\r\nEND:VEVENT\r\nEND:VCALENDAR\r\n";
  const Dictionary invited = recordOf(ItemKind::Calendars, event);
  std::string accepted = event;
  accepted.replace(accepted.find("NEEDS-ACTION"), 12, "ACCEPTED");
  EXPECT_EQ(keysNamed(recordOf(ItemKind::Calendars, accepted, &invited), "ATTENDEE"),
            keysNamed(invited, "ATTENDEE"));
  const Dictionary pid =
      recordOf(ItemKind::Contacts,
               "BEGIN:VCARD\r\nVERSION:4.0\r\nFN:P\r\nEMAIL;PID=1.1:a@example.org\r\n"
               "END:VCARD\r\n");
  const Dictionary moved =
      recordOf(ItemKind::Contacts,
               "BEGIN:VCARD\r\nVERSION:4.0\r\nFN:P\r\nEMAIL;PID=1.1;TYPE=work:b@example.org\r\n"
               "END:VCARD\r\n");
  EXPECT_EQ(keysNamed(pid, "EMAIL"), keysNamed(moved, "EMAIL"));
}

TEST(ItemModel, FilesThatAreNoItemsAreRefusedWithTheLineAndTheReason) {
  auto problem = [](ItemKind kind, const std::string& bytes) {
    std::string why;
    EXPECT_FALSE(recordOfBytes(kind, bytes, "x", nullptr, &why)) << bytes;
    return why;
  };
  EXPECT_EQ(
      problem(ItemKind::Contacts, "BEGIN:VCARD\r\nVERSION:3.0\r\nno colon here\r\nEND:VCARD\r\n"),
      "line 3 is not a content line");
  EXPECT_EQ(problem(ItemKind::Contacts,
                    "BEGIN:VCARD\r\nFN:a\r\nEND:VCARD\r\nBEGIN:VCARD\r\nFN:b\r\nEND:VCARD\r\n"),
            "there is more after END:VCARD");
  EXPECT_EQ(problem(ItemKind::Contacts, "BEGIN:VCARD\r\nFN:no end\r\n"), "there is no END:VCARD");
  EXPECT_EQ(problem(ItemKind::Calendars,
                    "BEGIN:VCALENDAR\r\nBEGIN:VTIMEZONE\r\nEND:VTIMEZONE\r\nEND:VCALENDAR\r\n"),
            "a VTIMEZONE has no TZID");
  EXPECT_EQ(problem(ItemKind::Calendars,
                    "BEGIN:VCALENDAR\r\nBEGIN:VEVENT\r\nUID:a\r\nEND:VEVENT\r\nBEGIN:VEVENT\r\n"
                    "UID:a\r\nEND:VEVENT\r\nEND:VCALENDAR\r\n"),
            "VEVENT//a is there twice");
}

TEST(ItemModel, AMergedItemMayKeepTheFaultsOfItsInputsButNeverAddOne) {
  const std::string event =
      "BEGIN:VCALENDAR\r\nVERSION:2.0\r\nPRODID:-//x//EN\r\nBEGIN:VEVENT\r\nUID:e\r\n"
      "DTSTAMP:20250101T000000Z\r\nDTSTART:20250101T100000Z\r\nDTEND:20250101T110000Z\r\n"
      "END:VEVENT\r\nEND:VCALENDAR\r\n";
  std::string backwards = event;
  backwards.replace(backwards.find("DTEND:20250101T110000Z"), 22, "DTEND:20250101T090000Z");
  EXPECT_THAT(vtc::client::itemProblems(ItemKind::Calendars, backwards),
              ElementsAre("VEVENT e ends before it starts"));
  EXPECT_EQ(vtc::client::newProblem(ItemKind::Calendars, backwards, {event}),
            "VEVENT e ends before it starts");
  EXPECT_EQ(vtc::client::newProblem(ItemKind::Calendars, backwards, {event, backwards}),
            std::nullopt);
  EXPECT_THAT(vtc::client::itemProblems(ItemKind::Contacts,
                                        "BEGIN:VCARD\r\nVERSION:3.0\r\nN:A;;;;\r\nEND:VCARD\r\n"),
              ElementsAre("it has no FN"));
  EXPECT_THAT(vtc::client::itemProblems(ItemKind::Contacts,
                                        "BEGIN:VCARD\r\nVERSION:2.1\r\nN:A;;;;\r\nEND:VCARD\r\n"),
              testing::IsEmpty());
}

}  // namespace
