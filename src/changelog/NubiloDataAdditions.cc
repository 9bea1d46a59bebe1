#include "VantorSyncManager/NubiloDataAdditions.h"

#include <zlib.h>

#include <algorithm>
#include <iterator>

#include "changelog/ChangeLogFormat.h"
#include "common/Format.h"
#include "common/Utf8.h"
#include "platform/plist/PlistCodec.h"

namespace {

constexpr size_t kStep = 4096;
constexpr uint8_t kGzipHeader[10] = {0x1F, 0x8B, 0x08, 0x00, 0x00, 0x00, 0x00, 0x00, 0x00, 0x03};

struct CodePointRange {
  char32_t first, last;
};
constexpr CodePointRange kControlCharacters[] = {
#include "changelog/ControlCharacterTable.inc"
};

bool isControlCharacter(char32_t c) {
  auto it = std::upper_bound(std::begin(kControlCharacters), std::end(kControlCharacters), c,
                             [](char32_t v, const CodePointRange& r) { return v < r.first; });
  return it != std::begin(kControlCharacters) && c <= std::prev(it)->last;
}

// The code point starting at s[i] and its length in bytes; a malformed
// sequence is one byte long and never a control character.
std::pair<char32_t, size_t> decode(std::string_view s, size_t i) {
  const auto* p = reinterpret_cast<const uint8_t*>(s.data());
  char32_t cp;
  const size_t length = vtc::utf8::decode(p + i, p + s.size(), cp);
  if (length == 0) return {0xFFFD, 1};
  return {cp, length};
}

}  // namespace

void vtc::clog::beyondBounds(uint64_t length, uint64_t offset) {
  corrupt(format("Attempting to parse value beyond bounds of changelog data length:%d offset:%d",
                 length, offset));
}

uint32_t NubiloUInt32AtOffset(vtc::ByteView data, uint32_t offset) {
  if (data.size() < static_cast<uint64_t>(offset) + 4) vtc::clog::beyondBounds(data.size(), offset);
  const uint8_t* p = data.data() + offset;
  return (uint32_t{p[0]} << 24) | (uint32_t{p[1]} << 16) | (uint32_t{p[2]} << 8) | p[3];
}

void NubiloAppendUInt32(vtc::Bytes& data, uint32_t value) {
  const uint8_t bytes[4] = {static_cast<uint8_t>(value >> 24), static_cast<uint8_t>(value >> 16),
                            static_cast<uint8_t>(value >> 8), static_cast<uint8_t>(value)};
  data.insert(data.end(), bytes, bytes + 4);
}

void NubiloAppendString(vtc::Bytes& data, std::string_view string) {
  data.insert(data.end(), string.begin(), string.end());
  data.push_back(0);
}

namespace {

// Runs a zlib stream in fixed 4096-byte output steps, appending to out,
// while step() answers Z_OK. False when zlib reports an error.
template <typename Step, typename End>
bool drain(z_stream& z, vtc::Bytes& out, Step step, End end) {
  int ret;
  do {
    size_t used = out.size();
    out.resize(used + kStep);
    z.next_out = out.data() + used;
    z.avail_out = kStep;
    ret = step(&z);
    out.resize(used + kStep - z.avail_out);
    if (ret < 0) {
      end(&z);  // abandoned: the stream's own error decides
      return false;
    }
  } while (ret == Z_OK);
  return end(&z) == Z_OK;
}

}  // namespace

std::optional<vtc::Bytes> NubiloGzip(vtc::ByteView data) {
  vtc::Bytes out(kGzipHeader, kGzipHeader + sizeof kGzipHeader);
  z_stream z{};
  if (deflateInit2(&z, Z_DEFAULT_COMPRESSION, Z_DEFLATED, -15, 8, Z_DEFAULT_STRATEGY) != Z_OK)
    return std::nullopt;
  z.next_in = const_cast<Bytef*>(data.data());
  z.avail_in = static_cast<uInt>(data.size());
  if (!drain(
          z, out, [](z_stream* s) { return deflate(s, Z_FINISH); }, deflateEnd))
    return std::nullopt;
  return out;
}

std::optional<vtc::Bytes> NubiloCopyGunzip(vtc::ByteView data) {
  if (data.size() <= 9) return std::nullopt;
  z_stream z{};
  if (inflateInit2(&z, -15) != Z_OK) return std::nullopt;
  z.next_in = const_cast<Bytef*>(data.data() + 10);  // the header is never examined
  z.avail_in = static_cast<uInt>(data.size() - 10);
  vtc::Bytes out;
  if (!drain(
          z, out, [](z_stream* s) { return inflate(s, Z_SYNC_FLUSH); }, inflateEnd))
    return std::nullopt;
  return out;
}

std::optional<vtc::Bytes> NubiloGunzip(vtc::ByteView data) {
  return NubiloCopyGunzip(data);
}

std::optional<vtc::Value> NubiloDictionaryWithData(vtc::ByteView data) {
  return vtc::plist::parse(data);
}

std::string NubiloStringByStrippingControlCharacters(std::string_view string) {
  std::string out;
  out.reserve(string.size());
  for (size_t i = 0; i < string.size();) {
    auto [cp, len] = decode(string, i);
    if (!isControlCharacter(cp)) out.append(string.substr(i, len));
    i += len;
  }
  return out;
}
