// Reads binary property lists ("bplist00") into values. Every offset, length
// and reference is checked against the document; nesting is bounded, an
// object that refers back to itself is refused, and the values built are
// bounded by the document's size (references are counted before anything
// they lead to is built), so time and memory follow the bytes given.
#pragma once

#include <optional>

#include "VantorSyncManager/Value.h"

namespace vtc::plist {

// The document's top object, or nullopt when the bytes are not a well-formed
// binary property list. Strings are always read as valid UTF-8 (malformed
// text becomes U+FFFD) and may hold zero characters. Null and UID objects
// read as none values, sets as arrays.
std::optional<Value> parseBinary(ByteView bytes);

}  // namespace vtc::plist
