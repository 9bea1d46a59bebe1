// Strict UTF-8 decoding, the one rule for what counts as well-formed text.
#pragma once

#include <cstddef>
#include <cstdint>

namespace vtc::utf8 {

// The length of the well-formed sequence starting at p (end bounds it) with
// its code point in cp, or 0 when the bytes there are no such sequence: a
// stray continuation byte, a lead byte C0, C1 or F5..FF, a sequence cut
// short, an overlong form, a surrogate (ED A0..BF) or a value past U+10FFFF.
inline size_t decode(const uint8_t* p, const uint8_t* end, char32_t& cp) {
  const uint8_t c = *p;
  if (c < 0x80) {
    cp = c;
    return 1;
  }
  const size_t length = (c >> 5) == 0x6 ? 2 : (c >> 4) == 0xE ? 3 : (c >> 3) == 0x1E ? 4 : 0;
  if (length == 0 || static_cast<size_t>(end - p) < length) return 0;
  char32_t v = c & (0x7F >> length);
  for (size_t k = 1; k < length; ++k) {
    if ((p[k] & 0xC0) != 0x80) return 0;
    v = v << 6 | (p[k] & 0x3F);
  }
  static constexpr char32_t kSmallest[] = {0, 0, 0x80, 0x800, 0x10000};
  if (v < kSmallest[length] || v > 0x10FFFF || (v >= 0xD800 && v <= 0xDFFF)) return 0;
  cp = v;
  return length;
}

}  // namespace vtc::utf8
