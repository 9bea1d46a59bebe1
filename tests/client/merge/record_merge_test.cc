// How two computers' edits of one item combine, case by case. Each case
// starts from one item both computers synced, edits it on each side as a
// person would (the bytes of the file), and reads each side's file the way
// the sync reads it; the merged item is then written as the sync writes it.
#include <gmock/gmock.h>

#include "client/items/ItemRecord.h"
#include "client/merge/RecordDecision.h"
#include "client/merge/RecordMerge.h"
#include "client/merge/Restore.h"

namespace {

using testing::HasSubstr;
using vtc::Dictionary;
using vtc::Value;
using vtc::client::ItemKind;
using vtc::client::renderRecord;
using vtc::client::merge::Merged;
using vtc::client::merge::mergeRecord;

std::string edit(std::string bytes, const std::string& from, const std::string& to) {
  const size_t at = bytes.find(from);
  EXPECT_NE(at, std::string::npos) << from;
  if (at != std::string::npos) bytes.replace(at, from.size(), to);
  return bytes;
}

struct Case {
  ItemKind kind;
  std::string base;    // the item both computers synced
  std::string ours;    // this computer's file now
  std::string theirs;  // the other computer's file, as it reached the share first
};

struct Outcome {
  std::string bytes;              // the merged item as written here
  std::vector<std::string> lost;  // "key: lost value"
  Merged merged;
};

Dictionary read(ItemKind kind, const std::string& bytes, const Dictionary* base) {
  std::string problem;
  auto record = vtc::client::recordOfBytes(kind, bytes, "item", base, &problem);
  EXPECT_TRUE(record) << problem;
  return record.value_or(Dictionary{});
}

Outcome merge(const Case& c, bool join = false) {
  const Dictionary base = read(c.kind, c.base, nullptr);
  const Dictionary ours = read(c.kind, c.ours, join ? nullptr : &base);
  const Dictionary theirs = read(c.kind, c.theirs, join ? nullptr : &base);
  Outcome out;
  out.merged =
      mergeRecord(c.kind, join ? std::nullopt : std::optional<Dictionary>(base), ours, theirs);
  if (out.merged.record) out.bytes = renderRecord(*out.merged.record, &ours).value_or("(none)");
  for (const auto& lost : out.merged.lost)
    out.lost.push_back(std::string(vtc::client::nameOf(lost.key)) + ": " +
                       (lost.lost.isString() ? lost.lost.string()
                        : lost.lost.isNone() ? "(removed)"
                                             : "(whole)"));
  return out;
}

const std::string kCard =
    "BEGIN:VCARD\r\nVERSION:3.0\r\nUID:ada\r\nFN:Ada Lovelace\r\nN:Lovelace;Ada;;;\r\n"
    "TEL;TYPE=cell:+44 111\r\nTEL;TYPE=work:+44 222\r\nTEL;TYPE=home:+44 333\r\n"
    "NOTE:A note long enough that an editor folds it somewhere in the middle of the line.\r\n"
    "END:VCARD\r\n";

TEST(RecordMerge, ContactsMergeAtTheGrainPeopleEdit) {
  // TEL #2 edited here while TEL #1 was deleted there: both stand.
  Outcome o = merge({ItemKind::Contacts, kCard, edit(kCard, "+44 222", "+44 999"),
                     edit(kCard, "TEL;TYPE=cell:+44 111\r\n", "")});
  EXPECT_EQ(o.bytes, edit(edit(kCard, "+44 222", "+44 999"), "TEL;TYPE=cell:+44 111\r\n", ""));
  EXPECT_TRUE(o.lost.empty());

  // A parameter-only edit and a value edit of two instances.
  o = merge({ItemKind::Contacts, kCard, edit(kCard, "TYPE=home", "TYPE=main"),
             edit(kCard, "+44 111", "+44 000")});
  EXPECT_EQ(o.bytes, edit(edit(kCard, "TYPE=home", "TYPE=main"), "+44 111", "+44 000"));

  // A re-fold by an editor is no edit: the real NOTE edit stands, either way round.
  const std::string refolded =
      edit(kCard, "in the middle of the line.", "in the middle\r\n  of the line.");
  const std::string realEdit = edit(kCard, "A note long enough", "A rewritten note, long enough");
  o = merge({ItemKind::Contacts, kCard, refolded, realEdit});
  EXPECT_EQ(o.bytes, realEdit);
  EXPECT_TRUE(o.lost.empty());
  o = merge({ItemKind::Contacts, kCard, realEdit, refolded});
  EXPECT_EQ(o.bytes, realEdit);
  EXPECT_TRUE(o.lost.empty());

  // Both stamped their edits: the later stamp stands, and it is no conflict.
  const std::string stamped = edit(kCard, "UID:ada\r\n", "UID:ada\r\nREV:20250101T000000Z\r\n");
  o = merge({ItemKind::Contacts, stamped, edit(stamped, "20250101T000000Z", "20250301T000000Z"),
             edit(stamped, "20250101T000000Z", "20250201T000000Z")});
  EXPECT_THAT(o.bytes, HasSubstr("REV:20250301T000000Z\r\n"));
  EXPECT_TRUE(o.lost.empty());

  // One field changed on both sides: the share's value stands, ours is kept.
  o = merge({ItemKind::Contacts, kCard, edit(kCard, "FN:Ada Lovelace", "FN:Ada King"),
             edit(kCard, "FN:Ada Lovelace", "FN:Augusta Ada")});
  EXPECT_THAT(o.bytes, HasSubstr("FN:Augusta Ada\r\n"));
  EXPECT_THAT(o.lost, testing::ElementsAre("FN: FN:Ada King\r\n"));

  // New properties of both sides keep their places.
  o = merge({ItemKind::Contacts, kCard,
             edit(kCard, "N:Lovelace", "EMAIL:ada@here.example\r\nN:Lovelace"),
             edit(kCard, "END:VCARD", "URL:https://there.example\r\nEND:VCARD")});
  EXPECT_EQ(o.bytes, edit(edit(kCard, "N:Lovelace", "EMAIL:ada@here.example\r\nN:Lovelace"),
                          "END:VCARD", "URL:https://there.example\r\nEND:VCARD"));
}

TEST(RecordMerge, AJoinWithoutACommonBaseTakesBothSidesAndTheSharesWhereTheyDiffer) {
  const std::string here = edit(edit(kCard, "FN:Ada Lovelace", "FN:Ada L."), "END:VCARD",
                                "EMAIL:ada@example.org\r\nEND:VCARD");
  const std::string there = edit(kCard, "TEL;TYPE=home:+44 333\r\n", "TEL;TYPE=home:+44 444\r\n");
  Outcome o = merge({ItemKind::Contacts, kCard, here, there}, /*join=*/true);
  EXPECT_THAT(o.bytes, HasSubstr("FN:Ada Lovelace\r\n"));        // the share's
  EXPECT_THAT(o.bytes, HasSubstr("EMAIL:ada@example.org\r\n"));  // only here
  EXPECT_THAT(o.bytes, HasSubstr("TEL;TYPE=home:+44 333\r\n"));  // both numbers
  EXPECT_THAT(o.bytes, HasSubstr("TEL;TYPE=home:+44 444\r\n"));
  EXPECT_THAT(o.lost, testing::ElementsAre("FN: FN:Ada L.\r\n"));
  // The same item on both sides costs nothing.
  o = merge({ItemKind::Contacts, kCard, kCard, kCard}, true);
  EXPECT_EQ(o.bytes, kCard);
  EXPECT_TRUE(o.lost.empty());
}

TEST(RecordMerge, AnEditBeatsADeleteInEitherOrder) {
  const Dictionary base = read(ItemKind::Contacts, kCard, nullptr);
  const Dictionary edited = read(ItemKind::Contacts, edit(kCard, "+44 111", "+44 000"), &base);
  Merged m = mergeRecord(ItemKind::Contacts, base, std::nullopt, edited);
  ASSERT_TRUE(m.record);
  EXPECT_EQ(*m.record, edited);
  EXPECT_TRUE(m.deleteUndone);
  m = mergeRecord(ItemKind::Contacts, base, edited, std::nullopt);
  ASSERT_TRUE(m.record);
  EXPECT_TRUE(m.restoredHere);
  // A delete against no edit stands.
  EXPECT_FALSE(mergeRecord(ItemKind::Contacts, base, std::nullopt, base).record);
  EXPECT_FALSE(mergeRecord(ItemKind::Contacts, base, base, std::nullopt).record);
}

TEST(RecordMerge, AMergeThatWouldMakeAWorseItemKeepsTheSharesWholeVersion) {
  // Version 2.1 needs no FN; 3.0 does. Here the card becomes 3.0, there its
  // FN goes: together they would make a 3.0 card without FN.
  const std::string card =
      "BEGIN:VCARD\r\nVERSION:2.1\r\nN:Doe;John\r\nFN:John Doe\r\nEND:VCARD\r\n";
  Outcome o = merge({ItemKind::Contacts, card, edit(card, "VERSION:2.1", "VERSION:3.0"),
                     edit(card, "FN:John Doe\r\n", "")});
  EXPECT_EQ(o.bytes, edit(card, "FN:John Doe\r\n", ""));
  EXPECT_THAT(o.lost, testing::ElementsAre("(record): (whole)"));
}

const std::string kSeries =
    "BEGIN:VCALENDAR\r\nVERSION:2.0\r\nPRODID:-//Example//EN\r\nBEGIN:VEVENT\r\nUID:s\r\n"
    "DTSTAMP:20250101T000000Z\r\nDTSTART:20250106T100000Z\r\nDTEND:20250106T110000Z\r\n"
    "RRULE:FREQ=WEEKLY;COUNT=10\r\nEXDATE:20250113T100000Z\r\nSUMMARY:Review\r\n"
    "BEGIN:VALARM\r\nACTION:DISPLAY\r\nDESCRIPTION:Soon\r\nTRIGGER:-PT10M\r\nEND:VALARM\r\n"
    "END:VEVENT\r\nBEGIN:VEVENT\r\nUID:s\r\nRECURRENCE-ID:20250120T100000Z\r\n"
    "DTSTAMP:20250101T000000Z\r\nDTSTART:20250120T140000Z\r\nDTEND:20250120T150000Z\r\n"
    "SUMMARY:Review (afternoon)\r\nEND:VEVENT\r\nEND:VCALENDAR\r\n";

TEST(RecordMerge, EventsMergeByOccurrenceAlarmAndTimeUnit) {
  // Two exceptions added, one on each computer.
  Outcome o =
      merge({ItemKind::Calendars, kSeries,
             edit(kSeries, "SUMMARY:Review\r\n", "EXDATE:20250127T100000Z\r\nSUMMARY:Review\r\n"),
             edit(kSeries, "SUMMARY:Review\r\n", "EXDATE:20250203T100000Z\r\nSUMMARY:Review\r\n")});
  EXPECT_THAT(o.bytes, HasSubstr("EXDATE:20250127T100000Z\r\n"));
  EXPECT_THAT(o.bytes, HasSubstr("EXDATE:20250203T100000Z\r\n"));
  EXPECT_TRUE(o.lost.empty());

  // Two alarms added.
  const std::string alarm =
      "BEGIN:VALARM\r\nACTION:DISPLAY\r\nDESCRIPTION:%\r\nTRIGGER:-PT%M\r\nEND:VALARM\r\n";
  auto withAlarm = [&](const std::string& minutes) {
    std::string a = edit(edit(alarm, "%", minutes), "%", minutes);
    return edit(kSeries, "END:VEVENT\r\nBEGIN:VEVENT", a + "END:VEVENT\r\nBEGIN:VEVENT");
  };
  o = merge({ItemKind::Calendars, kSeries, withAlarm("30"), withAlarm("60")});
  EXPECT_THAT(o.bytes, HasSubstr("TRIGGER:-PT30M"));
  EXPECT_THAT(o.bytes, HasSubstr("TRIGGER:-PT60M"));
  EXPECT_THAT(o.bytes, HasSubstr("TRIGGER:-PT10M"));

  // The start moved here, the end there: the share's times stand together,
  // and the event never ends before it starts.
  o = merge({ItemKind::Calendars, kSeries,
             edit(edit(kSeries, "DTSTART:20250106T100000Z", "DTSTART:20250106T120000Z"),
                  "DTEND:20250106T110000Z", "DTEND:20250106T130000Z"),
             edit(kSeries, "DTEND:20250106T110000Z", "DTEND:20250106T103000Z")});
  EXPECT_THAT(o.bytes, HasSubstr("DTSTART:20250106T100000Z\r\nDTEND:20250106T103000Z\r\n"));
  EXPECT_THAT(o.lost, testing::UnorderedElementsAre("DTSTART: DTSTART:20250106T120000Z\r\n",
                                                    "DTEND: DTEND:20250106T130000Z\r\n"));
}

TEST(RecordMerge, ASeriesMovedAgainstAnOccurrenceChangedElsewhereIsAConflictNeverADouble) {
  const std::string seriesMoved =
      edit(edit(kSeries, "DTSTART:20250106T100000Z", "DTSTART:20250106T090000Z"),
           "DTEND:20250106T110000Z", "DTEND:20250106T100000Z");
  const std::string occurrenceMoved =
      edit(kSeries, "END:VEVENT\r\nEND:VCALENDAR",
           "END:VEVENT\r\nBEGIN:VEVENT\r\nUID:s\r\nRECURRENCE-ID:20250203T100000Z\r\n"
           "DTSTAMP:20250101T000000Z\r\nDTSTART:20250203T160000Z\r\nDTEND:20250203T170000Z\r\n"
           "SUMMARY:Review (late)\r\nEND:VEVENT\r\nEND:VCALENDAR");
  // The series move reached the share first: the occurrence moved here goes.
  Outcome o = merge({ItemKind::Calendars, kSeries, occurrenceMoved, seriesMoved});
  EXPECT_EQ(o.bytes, seriesMoved);
  ASSERT_EQ(o.lost.size(), 1u);
  EXPECT_THAT(o.lost[0], HasSubstr("(component): BEGIN:VEVENT"));
  // The occurrence reached it first: the series stays where it was.
  o = merge({ItemKind::Calendars, kSeries, seriesMoved, occurrenceMoved});
  EXPECT_EQ(o.bytes, occurrenceMoved);
  EXPECT_EQ(o.lost.size(), 2u);
}

TEST(RecordMerge, AnOccurrenceRemovedOnOneComputerAndEditedOnTheOtherComesBackEdited) {
  const std::string removed =
      edit(kSeries,
           "BEGIN:VEVENT\r\nUID:s\r\nRECURRENCE-ID:20250120T100000Z\r\nDTSTAMP:20250101T000000Z\r\n"
           "DTSTART:20250120T140000Z\r\nDTEND:20250120T150000Z\r\nSUMMARY:Review (afternoon)\r\n"
           "END:VEVENT\r\n",
           "");
  const std::string edited = edit(kSeries, "Review (afternoon)", "Review (with guests)");
  Outcome o = merge({ItemKind::Calendars, kSeries, removed, edited});
  EXPECT_EQ(o.bytes, edited);
  ASSERT_EQ(o.lost.size(), 1u);
  EXPECT_THAT(o.lost[0], HasSubstr("(component): (removed)"));
  o = merge({ItemKind::Calendars, kSeries, edited, removed});
  EXPECT_EQ(o.bytes, edited);
}

TEST(RecordMerge, ADecisionSendsOnlyWhatTheShareLacksAndWritesOnlyWhatTheFileLacks) {
  using vtc::client::merge::decideRecord;
  const Dictionary base = read(ItemKind::Contacts, kCard, nullptr);
  const Dictionary ours = read(ItemKind::Contacts, edit(kCard, "+44 111", "+44 000"), &base);
  const Dictionary theirs =
      read(ItemKind::Contacts, edit(kCard, "FN:Ada Lovelace", "FN:Ada"), &base);
  auto d = decideRecord(ItemKind::Contacts, "ada", {base, ours, theirs, true, true, ours});
  ASSERT_TRUE(d.send);
  EXPECT_EQ(d.send->type(), SyncEngineChange::kModify);
  ASSERT_EQ(d.send->changes().size(), 1u);  // the phone number alone
  EXPECT_TRUE(d.folderTakes);               // the new FN
  d = decideRecord(ItemKind::Contacts, "ada", {base, base, base, false, false, base});
  EXPECT_FALSE(d.send || d.folderTakes || d.truthChanged);
  d = decideRecord(ItemKind::Contacts, "ada",
                   {base, std::nullopt, base, true, false, std::nullopt});
  ASSERT_TRUE(d.send);
  EXPECT_EQ(d.send->type(), SyncEngineChange::kDelete);
}

TEST(RecordMerge, ALosingValueCanBeRestoredIntoTheItemOrIntoOneThatIsGone) {
  using vtc::client::merge::restoredRecord;
  const Dictionary base = read(ItemKind::Contacts, kCard, nullptr);
  const std::string tel = vtc::client::recordOrder(base)[5];  // the first TEL
  auto restored = restoredRecord(ItemKind::Contacts, base, tel, Value("TEL:+44 555\r\n"), base);
  ASSERT_TRUE(restored);
  EXPECT_EQ(renderRecord(*restored), edit(kCard, "TEL;TYPE=cell:+44 111", "TEL:+44 555"));
  // The file is gone: the item as it stood comes back with the value.
  restored = restoredRecord(ItemKind::Contacts, std::nullopt, tel, Value("TEL:+44 555\r\n"), base);
  ASSERT_TRUE(restored);
  EXPECT_THAT(*renderRecord(*restored), HasSubstr("TEL:+44 555"));
  // A delete that lost is made again.
  EXPECT_FALSE(restoredRecord(ItemKind::Contacts, base, "(record)", Value(), base));
}

}  // namespace
