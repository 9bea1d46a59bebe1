#include "client/cli/TerminalText.h"

#include "common/Format.h"
#include "common/Utf8.h"

namespace vtc::client {

namespace {

bool needsEscape(char32_t c) {
  return c < 0x20 || (c >= 0x7F && c <= 0x9F) || c == 0x061C || c == 0x200B ||
         (c >= 0x200E && c <= 0x200F) || (c >= 0x202A && c <= 0x202E) ||
         (c >= 0x2066 && c <= 0x2069) || c == 0xFEFF;
}

}  // namespace

std::string shownSafely(std::string_view text) {
  std::string out;
  out.reserve(text.size());
  const auto* p = reinterpret_cast<const uint8_t*>(text.data());
  const auto* end = p + text.size();
  while (p < end) {
    char32_t c;
    const size_t length = utf8::decode(p, end, c);
    if (length == 0) {
      out += format("\\x%02x", *p++);
      continue;
    }
    if (needsEscape(c))
      out += c < 0x100 ? format("\\x%02x", static_cast<unsigned>(c))
                       : format("\\u%04x", static_cast<unsigned>(c));
    else
      out.append(reinterpret_cast<const char*>(p), length);
    p += length;
  }
  return out;
}

}  // namespace vtc::client
