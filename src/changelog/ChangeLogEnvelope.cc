#include "changelog/ChangeLogEnvelope.h"

#include <cstring>
#include <string_view>

#include "VantorSyncManager/NubiloDataAdditions.h"
#include "changelog/ChangeLogFormat.h"

namespace vtc::clog {

namespace {

// Header offset of a changelog without records: the format, the offset
// itself and the end of the index.
constexpr uint32_t kNoRecordsHeaderOffset = 12;

}  // namespace

std::optional<Envelope> readEnvelope(ByteView bytes) {
  if (bytes.size() < kNoRecordsHeaderOffset) return std::nullopt;
  if (NubiloUInt32AtOffset(bytes, 0) != kFormatNumber ||
      NubiloUInt32AtOffset(bytes, 4) != kNoRecordsHeaderOffset ||
      NubiloUInt32AtOffset(bytes, 8) != kIndexEnd)
    return std::nullopt;
  Envelope envelope;
  size_t at = kNoRecordsHeaderOffset;
  while (at < bytes.size()) {
    const void* zero = std::memchr(bytes.data() + at, 0, bytes.size() - at);
    if (!zero) return std::nullopt;
    const size_t end = static_cast<const uint8_t*>(zero) - bytes.data();
    const std::string_view line(reinterpret_cast<const char*>(bytes.data() + at), end - at);
    at = end + 1;
    if (line == kHeaderEnd) {
      if (!envelope.headers.contains(kBodyEncryptionHeader)) return std::nullopt;
      envelope.body = bytes.subspan(at);
      return envelope;
    }
    const size_t equals = line.find('=');
    if (equals == std::string_view::npos) return std::nullopt;
    envelope.headers.set(line.substr(0, equals), Value(std::string(line.substr(equals + 1))));
  }
  return std::nullopt;
}

Bytes envelopeHead(Dictionary headers) {
  headers.set("CreationTimestamp", Value(creationTimestamp()));
  Bytes out;
  NubiloAppendUInt32(out, kFormatNumber);
  NubiloAppendUInt32(out, kNoRecordsHeaderOffset);
  NubiloAppendUInt32(out, kIndexEnd);
  for (const std::string& line : headerLines(headers)) NubiloAppendString(out, line);
  NubiloAppendString(out, kHeaderEnd);
  return out;
}

}  // namespace vtc::clog
