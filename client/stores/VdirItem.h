// The two kinds of vdir items: vCards (".vcf") and iCalendar objects
// (".ics"). How an item is read, merged and written is in client/items.
#pragma once

namespace vtc::client {

enum class ItemKind { Contacts, Calendars };

// ".vcf" or ".ics".
const char* itemExtension(ItemKind kind);

}  // namespace vtc::client
