// One item of a vdir collection (a vCard or an iCalendar file) as the sync
// sees it: a dictionary of fields, each field the exact text of one or more
// content lines. Fields are what two computers can change independently: an
// edit of one field never touches the bytes of another.
//
// vCard: a field per property name, group included, in upper case ("EMAIL",
// "ITEM1.TEL"), holding every line of that property in file order
// ("VERSION" too; BEGIN and END are not fields). iCalendar: the calendar's
// own properties ("VCALENDAR/PRODID"), each time zone whole
// ("VTIMEZONE/<TZID>"), and per event, to-do or journal entry, identified by
// UID and RECURRENCE-ID, a field per property and one for its alarms
// ("VEVENT/<uid>[/<recurrence-id>]/SUMMARY", ".../VALARM"). Field values
// keep their folding as read, with every line ended by CRLF and a line
// longer than 75 octets folded: a file with bare LF ends splits into the
// same fields as its CRLF form.
#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "VantorSyncManager/Value.h"

namespace vtc::client {

enum class ItemKind { Contacts, Calendars };

// ".vcf" or ".ics".
const char* itemExtension(ItemKind kind);

// The fields of an item; none when the bytes are not a valid item of this
// kind (no BEGIN/END pair, a line that is no content line, an event
// without UID, two vCards or calendars in one file, ...).
std::optional<Dictionary> splitItem(ItemKind kind, std::string_view bytes);

// The bytes of an item after property changes ("set" with a value, "clear";
// SyncEngineChange's property-change dictionaries) applied to `current` (the
// item's bytes as they are now; none for a new item). Lines of untouched
// fields keep their bytes and places; a changed field takes the place of
// its old lines; a new field goes where its kind belongs (before the END of
// its component). Lines that a field value brings in with a bare LF get
// CRLF, and lines longer than 75 octets are folded, as the formats require.
// A set to a field's present value leaves its bytes alone; clearing every
// field of an event, to-do or journal entry removes it. A new item starts
// from BEGIN/END with the lines the formats require ("VERSION:3.0" for a
// vCard, placed first; "VERSION:2.0" and a PRODID for a calendar), which
// sets of those fields replace. Changes that are malformed, or values that
// do not make up the field they are set to (another property, a broken
// frame), raise std::invalid_argument, as do `current` bytes that are not a
// valid item.
std::string applyFieldChanges(ItemKind kind, const std::optional<std::string>& current,
                              const Array& propertyChanges);

}  // namespace vtc::client
