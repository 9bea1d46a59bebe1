// Reads binary property lists ("bplist00") into values. Every offset, length
// and reference is checked against the document; nesting is bounded, an
// object that refers back to itself is refused, and the values built are
// bounded by the document's size (references are counted before anything
// they lead to is built), so time and memory follow the bytes given.
#pragma once

#include <cstdint>
#include <optional>

#include "VantorSyncManager/Value.h"

namespace vtc::plist {

// Memory that several documents read one after another may take together
// (the record archives of one changelog): every value built costs
// kValueCost bytes, text and data their length. A document that would go
// over it is refused and the budget marked exhausted.
struct ReadBudget {
  static constexpr uint64_t kValueCost = sizeof(Value) + 16;
  uint64_t bytes = 0;
  bool exhausted = false;

  bool spend(uint64_t n) {
    if (exhausted || n > bytes) return !(exhausted = true);
    bytes -= n;
    return true;
  }
};

// The document's top object, or nullopt when the bytes are not a well-formed
// binary property list. Strings are always read as valid UTF-8 (malformed
// text becomes U+FFFD) and may hold zero characters. Null and UID objects
// read as none values, sets as arrays.
// A shared budget, when given, is charged as well.
std::optional<Value> parseBinary(ByteView bytes, ReadBudget* shared = nullptr);

}  // namespace vtc::plist
