// The one property-list layer: vtc::Value to and from libplist and XML, binary
// encodings (through BinaryPlistReader and BinaryPlistWriter, which the
// changelog's record archives need to be fast), and property-list files
// written atomically.
#pragma once

#include <optional>
#include <string>

#include <plist/plist.h>

#include "VantorSyncManager/Value.h"
#include "platform/plist/BinaryPlistReader.h"

namespace vtc::plist {

// A new libplist tree for the value; the caller frees it with plist_free.
// A none value has no property-list form and yields nullptr.
::plist_t toPlist(const Value& value);

// The value of a libplist node (a none value for a null node or a UID);
// nullopt when it nests deeper than readers read (binary::kMaxDepth) or
// goes over the budget given.
std::optional<Value> fromPlist(::plist_t node, ReadBudget* budget = nullptr);

// Parses XML or binary property-list bytes; nullopt when they are neither,
// nest deeper than binary::kMaxDepth, or go over the budget given. XML is
// measured before libplist builds anything, so that no document can nest
// deep enough to exhaust the stack of a recursive reader.
std::optional<Value> parse(ByteView bytes, ReadBudget* budget = nullptr);

std::string toXml(const Value& value);
Bytes toBinary(const Value& value);
// The same for an array, without wrapping (and copying) it into a Value.
Bytes toBinary(const Array& array);

// nullopt when the file is absent or is not a property list.
std::optional<Value> readFile(const std::string& path);

// Writes an XML property list to a temporary file beside path, flushes it and
// renames it over path. On failure path is unchanged and false is returned.
bool writeFileAtomically(const std::string& path, const Value& value, int mode = 0644);

}  // namespace vtc::plist
