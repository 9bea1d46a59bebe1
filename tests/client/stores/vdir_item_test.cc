// Items as fields: splitting vCards and calendars, and changing some fields
// while every other byte stays as it was.
#include <gtest/gtest.h>

#include <algorithm>
#include <stdexcept>
#include <string>

#include "FieldChanges.h"
#include "client/stores/VdirItem.h"

namespace {

using vtc::Array;
using vtc::Dictionary;
using vtc::Value;
using vtc::client::applyFieldChanges;
using vtc::client::ItemKind;
using vtc::client::splitItem;
using vtc::test::clearField;
using vtc::test::setField;
using vtc::test::setsOf;

// Test texts are written with "\n"; items want CRLF.
std::string crlf(std::string_view text) {
  std::string out;
  for (char c : text) out += c == '\n' ? std::string("\r\n") : std::string(1, c);
  return out;
}

Dictionary fieldsOf(ItemKind kind, std::string_view bytes) {
  auto fields = splitItem(kind, bytes);
  EXPECT_TRUE(fields) << bytes;
  return fields.value_or(Dictionary{});
}

// Every physical line of `bytes` ends in CRLF, fits 75 octets and does not
// begin inside a UTF-8 sequence.
::testing::AssertionResult conforms(const std::string& bytes) {
  size_t start = 0;
  while (start < bytes.size()) {
    size_t end = bytes.find("\r\n", start);
    if (end == std::string::npos) return ::testing::AssertionFailure() << "no CRLF at the end";
    std::string line = bytes.substr(start, end - start);
    if (line.find('\n') != std::string::npos) return ::testing::AssertionFailure() << "bare LF";
    if (line.size() > 75) return ::testing::AssertionFailure() << "longer than 75: " << line;
    size_t first = line.starts_with(' ') ? 1 : 0;  // after the fold's space
    if (line.size() > first && (static_cast<unsigned char>(line[first]) & 0xC0) == 0x80)
      return ::testing::AssertionFailure() << "fold inside a character: " << line;
    start = end + 2;
  }
  return ::testing::AssertionSuccess();
}

std::string unfold(std::string bytes) {
  for (size_t at; (at = bytes.find("\r\n ")) != std::string::npos;) bytes.erase(at, 3);
  return bytes;
}

const std::string kCard = crlf(
    "BEGIN:VCARD\n"
    "VERSION:3.0\n"
    "UID:card-1\n"
    "FN:Ada Lovelace\n"
    "N:Lovelace;Ada;;;\n"
    "EMAIL;TYPE=home:ada@example.org\n"
    "item1.TEL;type=pref:+44 20 7946 0000\n"
    "item1.X-ABLabel:studio\n"
    "X-ENGINE-NOTE;X-PARAM=\"a:b;c\";x-other=1:keeps its parameters\n"
    "NOTE:A note long enough to be folded by whoever wrote it, at the best place\n"
    "  and then some more.\n"
    "email;type=work:ada@work.example\n"
    "END:VCARD\n");

TEST(VdirItem, CardFieldsAreWholePropertiesWithGroupsInUpperCaseKeys) {
  Dictionary fields = fieldsOf(ItemKind::Contacts, kCard);
  EXPECT_EQ(fields.keys(),
            (std::vector<std::string>{"VERSION", "UID", "FN", "N", "EMAIL", "ITEM1.TEL",
                                      "ITEM1.X-ABLABEL", "X-ENGINE-NOTE", "NOTE"}));
  // Both EMAIL lines, in file order, with their bytes; folds stay where they were.
  EXPECT_EQ(fields["EMAIL"].string(),
            crlf("EMAIL;TYPE=home:ada@example.org\nemail;type=work:ada@work.example\n"));
  EXPECT_EQ(fields["NOTE"].string(),
            crlf("NOTE:A note long enough to be folded by whoever wrote it, at the best place\n"
                 "  and then some more.\n"));
}

TEST(VdirItem, BareLineFeedsAndOverlongLinesAreReadAsTheirConformingForm) {
  std::string lf = "BEGIN:VCARD\nVERSION:4.0\nFN:Grace\nNOTE:first line\n  continued\nEND:VCARD";
  Dictionary fields = fieldsOf(ItemKind::Contacts, lf);
  EXPECT_EQ(fields, fieldsOf(ItemKind::Contacts, crlf(lf) + "\r\n"));
  EXPECT_EQ(fields["NOTE"].string(), crlf("NOTE:first line\n  continued\n"));

  std::string longNote = "NOTE:" + std::string(100, 'x');
  fields = fieldsOf(ItemKind::Contacts, crlf("BEGIN:VCARD\n" + longNote + "\nEND:VCARD\n"));
  EXPECT_TRUE(conforms(fields["NOTE"].string()));
  EXPECT_EQ(unfold(fields["NOTE"].string()), longNote + "\r\n");
}

TEST(VdirItem, BytesThatAreNotOneWholeItemAreInvalid) {
  const char* cards[] = {
      "",
      "VERSION:3.0\r\nFN:x\r\n",                                                   // no BEGIN
      "BEGIN:VCARD\r\nFN:x\r\n",                                                   // no END
      "BEGIN:VCARD\r\nFN:x\r\nEND:VCARD\r\nBEGIN:VCARD\r\nFN:y\r\nEND:VCARD\r\n",  // two
      "BEGIN:VCARD\r\nFN x\r\nEND:VCARD\r\n",                                      // no colon
      "BEGIN:VCARD\r\n;FN:x\r\nEND:VCARD\r\n",                                     // no name
      "BEGIN:VCARD\r\nBEGIN:VCARD\r\nEND:VCARD\r\nEND:VCARD\r\n",                  // nested
      "BEGIN:VCALENDAR\r\nEND:VCALENDAR\r\n",                                      // other kind
  };
  for (const char* card : cards) EXPECT_FALSE(splitItem(ItemKind::Contacts, card)) << card;
  // Blank lines around the item and a byte order mark are no harm, and stay.
  std::string framed = "\xEF\xBB\xBF\r\nBEGIN:VCARD\r\nFN:x\r\nEND:VCARD\r\n\r\n";
  EXPECT_EQ(fieldsOf(ItemKind::Contacts, framed).keys(), std::vector<std::string>{"FN"});
  EXPECT_EQ(applyFieldChanges(ItemKind::Contacts, framed, Array{setField("FN", "FN:y\r\n")}),
            "\xEF\xBB\xBF\r\nBEGIN:VCARD\r\nFN:y\r\nEND:VCARD\r\n\r\n");

  const char* calendars[] = {
      "BEGIN:VCALENDAR\nBEGIN:VEVENT\nSUMMARY:no uid\nEND:VEVENT\nEND:VCALENDAR\n",
      "BEGIN:VCALENDAR\nBEGIN:VEVENT\nUID:a\nEND:VTODO\nEND:VCALENDAR\n",  // wrong END
      ("BEGIN:VCALENDAR\nBEGIN:VEVENT\nUID:a\nEND:VEVENT\nBEGIN:VEVENT\nUID:a\nEND:VEVENT\n"
       "END:VCALENDAR\n"),                                                         // same UID twice
      "BEGIN:VCALENDAR\nBEGIN:VEVENT\nUID:a\nUID:b\nEND:VEVENT\nEND:VCALENDAR\n",  // two UIDs
      "BEGIN:VCALENDAR\nBEGIN:VTIMEZONE\nX-NO-TZID:1\nEND:VTIMEZONE\nEND:VCALENDAR\n",
      "BEGIN:VCALENDAR\nEND:VCALENDAR\nBEGIN:VCALENDAR\nEND:VCALENDAR\n",  // two calendars
      "BEGIN:VCALENDAR\nBEGIN:VEVENT\nUID:a\nBEGIN:VALARM\nEND:VEVENT\nEND:VCALENDAR\n",
  };
  for (const char* calendar : calendars)
    EXPECT_FALSE(splitItem(ItemKind::Calendars, calendar)) << calendar;
}

TEST(VdirItem, ChangedFieldsTakeThePlaceOfTheirLinesAndNothingElseMoves) {
  Array changes{
      setField("EMAIL", "EMAIL;TYPE=work:ada@new.example\r\n"),  // two lines become one
      clearField("ITEM1.X-ABLABEL"),
      setField("TEL", "TEL;TYPE=cell:+44 7700 900000\r\n"),  // new: before END
      clearField("PHOTO"),                                   // not there: nothing to do
  };
  std::string out = applyFieldChanges(ItemKind::Contacts, kCard, changes);
  EXPECT_EQ(out,
            crlf("BEGIN:VCARD\n"
                 "VERSION:3.0\n"
                 "UID:card-1\n"
                 "FN:Ada Lovelace\n"
                 "N:Lovelace;Ada;;;\n"
                 "EMAIL;TYPE=work:ada@new.example\n"
                 "item1.TEL;type=pref:+44 20 7946 0000\n"
                 "X-ENGINE-NOTE;X-PARAM=\"a:b;c\";x-other=1:keeps its parameters\n"
                 "NOTE:A note long enough to be folded by whoever wrote it, at the best place\n"
                 "  and then some more.\n"
                 "TEL;TYPE=cell:+44 7700 900000\n"
                 "END:VCARD\n"));
  EXPECT_EQ(applyFieldChanges(ItemKind::Contacts, kCard, Array{}), kCard);

  // A bare-LF file keeps its untouched lines as they are; new lines get CRLF.
  // A set to the value a field has changes nothing.
  std::string lf = "BEGIN:VCARD\nFN:Grace\nNOTE:old\nEND:VCARD\n";
  EXPECT_EQ(
      applyFieldChanges(ItemKind::Contacts, lf,
                        Array{setField("NOTE", "NOTE:new\n"), setField("FN", "FN:Grace\r\n")}),
      "BEGIN:VCARD\nFN:Grace\nNOTE:new\r\nEND:VCARD\n");
}

TEST(VdirItem, LongTextIsFoldedAt75OctetsBetweenCharacters) {
  // Two-, three- and four-octet characters so that some fold falls on each.
  std::string text;
  for (int i = 0; i < 12; ++i) text += "Grüße aus Köln · 東京 · 🎉 ";
  std::string line = "NOTE;LANGUAGE=de:" + text + "\r\n";
  std::string out = applyFieldChanges(ItemKind::Contacts, kCard, Array{setField("NOTE", line)});
  EXPECT_TRUE(conforms(out));
  EXPECT_EQ(unfold(fieldsOf(ItemKind::Contacts, out)["NOTE"].string()), line);
  // Exactly 75 octets stay on one line; 76 fold.
  for (size_t size : {75u, 76u}) {
    std::string line = "NOTE:" + std::string(size - 5, 'n');
    out = applyFieldChanges(ItemKind::Contacts, kCard, Array{setField("NOTE", line)});
    EXPECT_EQ(out.find(line + "\r\n") != std::string::npos, size == 75) << size;
  }
}

TEST(VdirItem, ValuesThatDoNotBelongUnderTheirKeyAreRefused) {
  const Value refused[] = {
      setField("EMAIL", "TEL:+1 555 0100\r\n"),                    // another property
      setField("NOTE", "NOTE:x\r\nEND:VCARD\r\nBEGIN:VCARD\r\n"),  // breaks the frame
      setField("NOTE", ""),
      setField("note", "NOTE:x\r\n"),  // keys are upper case
      Value(Dictionary{{"action", "set"}, {"name", "NOTE"}}),
      Value(Dictionary{{"action", "rename"}, {"name", "NOTE"}}),
      Value("NOTE"),
  };
  for (const Value& change : refused)
    EXPECT_THROW(applyFieldChanges(ItemKind::Contacts, kCard, Array{change}), std::invalid_argument)
        << change.description();
  EXPECT_THROW(
      applyFieldChanges(ItemKind::Contacts, std::string("FN:x\r\n"), Array{clearField("FN")}),
      std::invalid_argument);
}

// A weekly event with an alarm, one moved occurrence, its time zone, and
// properties of the calendar that no program here knows.
const std::string kCalendar = crlf(
    "BEGIN:VCALENDAR\n"
    "VERSION:2.0\n"
    "PRODID:-//Example//Planner 7//EN\n"
    "X-WR-CALNAME;X-SCOPE=team:Team\n"
    "BEGIN:VTIMEZONE\n"
    "TZID:Europe/Berlin\n"
    "BEGIN:STANDARD\n"
    "DTSTART:19701025T030000\n"
    "TZOFFSETFROM:+0200\n"
    "TZOFFSETTO:+0100\n"
    "END:STANDARD\n"
    "END:VTIMEZONE\n"
    "BEGIN:VEVENT\n"
    "UID:weekly@example.org\n"
    "DTSTART;TZID=Europe/Berlin:20250303T090000\n"
    "RRULE:FREQ=WEEKLY;COUNT=10\n"
    "SUMMARY:Planning\n"
    "ATTENDEE;CN=\"Lovelace, Ada\":mailto:ada@example.org\n"
    "ATTENDEE;CN=Grace:mailto:grace@example.org\n"
    "BEGIN:VALARM\n"
    "ACTION:DISPLAY\n"
    "TRIGGER:-PT15M\n"
    "END:VALARM\n"
    "BEGIN:VALARM\n"
    "ACTION:AUDIO\n"
    "TRIGGER:-PT1M\n"
    "END:VALARM\n"
    "END:VEVENT\n"
    "BEGIN:VEVENT\n"
    "UID:weekly@example.org\n"
    "RECURRENCE-ID;TZID=Europe/Berlin:20250310T090000\n"
    "DTSTART;TZID=Europe/Berlin:20250310T140000\n"
    "SUMMARY:Planning (afternoon)\n"
    "END:VEVENT\n"
    "END:VCALENDAR\n");

TEST(VdirItem, CalendarFieldsPerComponentPropertyWithTimeZonesAndAlarmsWhole) {
  Dictionary fields = fieldsOf(ItemKind::Calendars, kCalendar);
  const std::string master = "VEVENT/weekly@example.org/";
  const std::string moved = "VEVENT/weekly@example.org/20250310T090000/";
  EXPECT_EQ(fields.keys(),
            (std::vector<std::string>{
                "VCALENDAR/VERSION", "VCALENDAR/PRODID", "VCALENDAR/X-WR-CALNAME",
                "VTIMEZONE/Europe/Berlin", master + "UID", master + "DTSTART", master + "RRULE",
                master + "SUMMARY", master + "ATTENDEE", master + "VALARM", moved + "UID",
                moved + "RECURRENCE-ID", moved + "DTSTART", moved + "SUMMARY"}));
  EXPECT_EQ(fields[master + "VALARM"].string(),
            crlf("BEGIN:VALARM\nACTION:DISPLAY\nTRIGGER:-PT15M\nEND:VALARM\n"
                 "BEGIN:VALARM\nACTION:AUDIO\nTRIGGER:-PT1M\nEND:VALARM\n"));
  EXPECT_TRUE(fields["VTIMEZONE/Europe/Berlin"].string().starts_with("BEGIN:VTIMEZONE\r\n"));
  EXPECT_TRUE(fields["VTIMEZONE/Europe/Berlin"].string().ends_with("END:VTIMEZONE\r\n"));
}

TEST(VdirItem, CalendarChangesLandInTheirComponentAndEmptiedOccurrencesGo) {
  const std::string master = "VEVENT/weekly@example.org/";
  const std::string moved = "VEVENT/weekly@example.org/20250310T090000/";
  const std::string next = "VEVENT/weekly@example.org/20250317T090000/";
  Array changes{
      setField(moved + "VALARM", "BEGIN:VALARM\r\nTRIGGER:-PT1H\r\nEND:VALARM\r\n"),
      setField(moved + "SUMMARY", "SUMMARY:Planning (late)\r\n"),
      setField(moved + "LOCATION", "LOCATION:Garden\r\n"),   // before the new alarm
      setField(master + "LOCATION", "LOCATION:Room 4\r\n"),  // before the alarms
      setField(master + "VALARM",
               "BEGIN:VALARM\r\nACTION:DISPLAY\r\nTRIGGER:-PT5M\r\nEND:VALARM\r\n"),
      setField("VCALENDAR/X-COLOR", "X-COLOR:#336699\r\n"),  // before the components
      // A new occurrence, given field by field.
      setField(next + "SUMMARY", "SUMMARY:Planning (remote)\r\n"),
      setField(next + "UID", "UID:weekly@example.org\r\n"),
      setField(next + "RECURRENCE-ID", "RECURRENCE-ID;TZID=Europe/Berlin:20250317T090000\r\n"),
  };
  std::string out = applyFieldChanges(ItemKind::Calendars, kCalendar, changes);
  std::string expected = kCalendar;
  auto replace = [&](std::string_view from, std::string_view to) {
    size_t at = expected.find(crlf(from));
    ASSERT_NE(at, std::string::npos) << from;
    expected.replace(at, crlf(from).size(), crlf(to));
  };
  replace("X-WR-CALNAME;X-SCOPE=team:Team\n", "X-WR-CALNAME;X-SCOPE=team:Team\nX-COLOR:#336699\n");
  replace(
      "ATTENDEE;CN=Grace:mailto:grace@example.org\nBEGIN:VALARM\nACTION:DISPLAY\nTRIGGER:-PT15M\n"
      "END:VALARM\nBEGIN:VALARM\nACTION:AUDIO\nTRIGGER:-PT1M\nEND:VALARM\n",
      "ATTENDEE;CN=Grace:mailto:grace@example.org\nLOCATION:Room 4\n"
      "BEGIN:VALARM\nACTION:DISPLAY\nTRIGGER:-PT5M\nEND:VALARM\n");
  replace("SUMMARY:Planning (afternoon)\nEND:VEVENT\n",
          "SUMMARY:Planning (late)\nLOCATION:Garden\n"
          "BEGIN:VALARM\nTRIGGER:-PT1H\nEND:VALARM\nEND:VEVENT\n"
          "BEGIN:VEVENT\nSUMMARY:Planning (remote)\nUID:weekly@example.org\n"
          "RECURRENCE-ID;TZID=Europe/Berlin:20250317T090000\nEND:VEVENT\n");
  EXPECT_EQ(out, expected);

  // Clearing every field of an occurrence removes it, BEGIN and END too.
  Array removeMoved;
  for (const char* field : {"UID", "RECURRENCE-ID", "DTSTART", "SUMMARY"})
    removeMoved.push_back(clearField(moved + field));
  out = applyFieldChanges(ItemKind::Calendars, kCalendar, removeMoved);
  EXPECT_EQ(out,
            kCalendar.substr(0, kCalendar.find("BEGIN:VEVENT\r\nUID:weekly@example.org\r\nRECU")) +
                "END:VCALENDAR\r\n");
  // A new component without its UID cannot be placed.
  EXPECT_THROW(applyFieldChanges(ItemKind::Calendars, kCalendar,
                                 Array{setField(next + "SUMMARY", "SUMMARY:lost\r\n")}),
               std::invalid_argument);
}

TEST(VdirItem, NewItemsFromTheSetsOfAnotherItemSplitIntoTheSameFields) {
  std::string card = crlf(
      "BEGIN:VCARD\nFN:No Version Yet\nitem2.ADR:;;1 Main St;Springfield;;;\n"
      "X-SOCIAL;TYPE=x:@someone\nEND:VCARD\n");
  for (const auto& [kind, bytes] :
       {std::pair{ItemKind::Contacts, kCard}, std::pair{ItemKind::Contacts, card},
        std::pair{ItemKind::Calendars, kCalendar}}) {
    Dictionary fields = fieldsOf(kind, bytes);
    std::string built = applyFieldChanges(kind, std::nullopt, setsOf(fields));
    EXPECT_TRUE(conforms(built));
    Dictionary again = fieldsOf(kind, built);
    if (kind == ItemKind::Contacts && !fields.contains("VERSION")) {
      // A vCard needs a VERSION; it goes first.
      EXPECT_TRUE(built.starts_with("BEGIN:VCARD\r\nVERSION:3.0\r\n")) << built;
      again.erase("VERSION");
    }
    EXPECT_EQ(again, fields) << built;
  }
  // A calendar is built with its properties, time zones and then events,
  // whatever order the sets came in.
  Dictionary fields = fieldsOf(ItemKind::Calendars, kCalendar);
  Array reversed = setsOf(fields);
  std::reverse(reversed.begin(), reversed.end());
  std::string built = applyFieldChanges(ItemKind::Calendars, std::nullopt, reversed);
  EXPECT_EQ(fieldsOf(ItemKind::Calendars, built), fields);
  EXPECT_LT(built.find("X-WR-CALNAME"), built.find("BEGIN:VTIMEZONE"));
  EXPECT_LT(built.find("BEGIN:VTIMEZONE"), built.find("BEGIN:VEVENT"));
  EXPECT_LT(built.find("RRULE"), built.find("BEGIN:VALARM"));
}

}  // namespace
