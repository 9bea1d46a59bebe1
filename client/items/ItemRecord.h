// An item as a record: what the engine keeps and the changelogs carry.
//
//   "(file)"   the item's file name
//   "(order)"  the keys of its units in file order, one per line
//   <key>      one unit's exact bytes (a string, or data when they are not
//              UTF-8)
//
// A key is the unit's name, after its component's scope for a unit inside
// an event, to-do or journal entry ("VEVENT//<uid>/SUMMARY"). A property
// that may occur more than once (TEL, EMAIL, ATTENDEE, EXDATE, an alarm,
// an X- property, ...) has one key per instance ("TEL#1f3a09c2"): an
// instance keeps its key across edits, matched against the record the
// file had before; a new one gets a key from what it holds, so that two
// computers that made the same item give it the same keys.
//
// A record's identity is the item's UID; an item without one is known by
// its file name.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "VantorSyncManager/Value.h"
#include "client/items/ItemText.h"

namespace vtc::client {

inline constexpr char kFileField[] = "(file)";
inline constexpr char kOrderField[] = "(order)";

// The identity of the item in a file.
std::string recordIdentity(const ItemText& text, const std::string& fileName);

// The record of an item's units. previous: the record of the same file (or
// of the same item) before, whose instance keys are kept.
Dictionary toRecord(const ItemText& text, const std::string& fileName,
                    const Dictionary* previous = nullptr);

// The record of an item's bytes; none when they are no item of this kind.
std::optional<Dictionary> recordOfBytes(ItemKind kind, std::string_view bytes,
                                        const std::string& fileName,
                                        const Dictionary* previous = nullptr,
                                        std::string* problem = nullptr);

// The record with each instance that `reference` also holds (the same
// identity under the same plain key) renamed to the reference's key: two
// computers that made the same item apart then name its units alike.
Dictionary rekeyInstances(const Dictionary& record, const Dictionary& reference);

// The bytes of a record: its units in order; units not in the order go
// before the end of their component. Where `local` (the file's own record
// now) has a unit of the same key and meaning, its bytes are used, so that
// a file keeps the bytes nothing changed. None, with *problem set, when the
// record cannot make an item (no frame, a value that is no unit's bytes).
// *rendered (when given) is the record of the bytes made: the units
// written, in order, under the record's keys and file name.
std::optional<std::string> renderRecord(const Dictionary& record, const Dictionary* local = nullptr,
                                        std::string* problem = nullptr,
                                        Dictionary* rendered = nullptr);

// The keys of a record in order ("(order)" read).
std::vector<std::string> recordOrder(const Dictionary& record);
std::string joinOrder(const std::vector<std::string>& keys);
// The file name a record names, or empty.
const std::string& recordFile(const Dictionary& record);

// The parts of a key: the component scope ("" at the item's own level) and
// the unit's name without its instance ("TEL", "DTSTART", "VALARM",
// "(begin)").
std::string_view scopeOf(std::string_view key);
std::string_view nameOf(std::string_view key);
// Whether a key is structure, not content: the frame, "(file)", "(order)".
bool isStructureKey(std::string_view key);

// A digest of a record under its identity: the same for the same units,
// keys and file name on every computer, whatever order they were set in.
// The digest of a set of records is the exclusive or of theirs.
uint64_t recordDigest(const std::string& id, const Dictionary& record);

// A person's name for the item: its FN or SUMMARY, else its file name.
std::string displayName(const Dictionary& record);

}  // namespace vtc::client
