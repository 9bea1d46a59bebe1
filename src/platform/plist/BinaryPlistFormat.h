// Layout constants of binary property lists ("bplist00"), shared by the
// reader and the writer. A document is the magic, the objects, a table of
// object offsets and a 32-byte trailer; each object starts with a marker
// byte whose high nibble is its kind and whose low nibble is a small length.
#pragma once

#include <cstddef>
#include <cstdint>
#include <cstring>

namespace vtc::plist::binary {

inline constexpr uint8_t kMagic[] = {'b', 'p', 'l', 'i', 's', 't', '0', '0'};
inline constexpr size_t kMagicSize = sizeof kMagic;
inline constexpr size_t kTrailerSize = 32;

// Marker kinds (high nibble).
inline constexpr uint8_t kSimple = 0x0;  // 0x00 null, 0x08 false, 0x09 true
inline constexpr uint8_t kInteger = 0x1;
inline constexpr uint8_t kReal = 0x2;
inline constexpr uint8_t kDate = 0x3;
inline constexpr uint8_t kData = 0x4;
inline constexpr uint8_t kAsciiString = 0x5;
inline constexpr uint8_t kUtf16String = 0x6;
inline constexpr uint8_t kUid = 0x8;
inline constexpr uint8_t kArray = 0xA;
inline constexpr uint8_t kSet = 0xC;
inline constexpr uint8_t kDictionary = 0xD;

inline constexpr uint8_t kFalse = 0x08;
inline constexpr uint8_t kTrue = 0x09;
inline constexpr uint8_t kDateMarker = 0x33;
inline constexpr uint8_t kDoubleMarker = 0x23;
// A low nibble of 0xF means the length follows as an integer object.
inline constexpr uint8_t kLengthFollows = 0xF;

// The deepest nesting a document may have, its top object at depth 0. The
// writer refuses deeper values, so that what one computer writes every
// other one reads.
inline constexpr unsigned kMaxDepth = 128;

// What reading a document may build, in proportion to its size: one value per
// reference (each reference takes at least a byte), and this many bytes of
// text per byte. A string read from n bytes costs up to 3n (bytes past ASCII
// become U+FFFD), so the writer shares only strings short enough that each
// extra reference, itself at least a byte, pays for its copy.
inline constexpr uint64_t kTextBytesPerByte = 64;
inline constexpr size_t kMaxSharedStringBytes = kTextBytesPerByte / 3;

// Dates count seconds from 2001-01-01 00:00:00 UTC.
inline constexpr int64_t kEpochOffsetSeconds = 978307200;

inline uint64_t readBigEndian(const uint8_t* p, size_t width) {
  // The widths that occur get straight-line code; references and offsets are
  // read for every object.
  switch (width) {
    case 1:
      return p[0];
    case 2:
      return uint64_t{p[0]} << 8 | p[1];
    default: {
      uint64_t v = 0;
      for (size_t i = 0; i < width; ++i) v = (v << 8) | p[i];
      return v;
    }
  }
}

// Whether text fits an ASCII string object (else it is stored as UTF-16).
// Eight bytes at a time; text is mostly short, so the tail matters too.
inline bool isAscii(const uint8_t* s, size_t length) {
  uint64_t high = 0;
  size_t i = 0;
  for (; i + 8 <= length; i += 8) {
    uint64_t word;
    std::memcpy(&word, s + i, 8);
    high |= word;
  }
  for (; i < length; ++i) high |= s[i];
  return (high & 0x8080808080808080ull) == 0;
}

}  // namespace vtc::plist::binary
