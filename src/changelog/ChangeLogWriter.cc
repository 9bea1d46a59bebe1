// The changelog writer: index, headers, then the compressed body.
#include <ctime>

#include "VantorSyncManager/NubiloChangeLog.h"
#include "VantorSyncManager/NubiloDataAdditions.h"
#include "changelog/ChangeLogFormat.h"
#include "common/Clock.h"
#include "common/Format.h"
#include "platform/plist/BinaryPlistWriter.h"

namespace {

std::string creationTimestamp() {
  std::time_t t = std::chrono::system_clock::to_time_t(vtc::currentClock().now());
  std::tm tm{};
  localtime_r(&t, &tm);
  char buf[32];
  std::strftime(buf, sizeof buf, "%m/%d/%y %H:%M:%S", &tm);
  return buf;
}

void putUInt32At(vtc::Bytes& out, size_t offset, uint32_t v) {
  out[offset] = static_cast<uint8_t>(v >> 24);
  out[offset + 1] = static_cast<uint8_t>(v >> 16);
  out[offset + 2] = static_cast<uint8_t>(v >> 8);
  out[offset + 3] = static_cast<uint8_t>(v);
}

}  // namespace

void NubiloChangeLog::writeToData(vtc::Bytes& output) {
  const size_t n = _changes.size();
  const size_t indexSize = 12 + 4 * n;
  output.assign(indexSize, 0);
  // The index is written in place: format number, header offset, one entry
  // per record, then the end marker.
  putUInt32At(output, 0, vtc::clog::kFormatNumber);
  putUInt32At(output, 4, static_cast<uint32_t>(indexSize));

  // Set directly: a mapped changelog refuses header changes from callers.
  if (!_headers) _headers = vtc::Dictionary{};
  _headers->set("CreationTimestamp", vtc::Value(creationTimestamp()));
  for (const auto& [key, value] : *_headers)
    NubiloAppendString(output, vtc::format("%@=%@", key, value));
  NubiloAppendString(output, vtc::clog::kHeaderEnd);
  const size_t bodyStart = output.size();

  vtc::Bytes body;
  vtc::plist::BinaryPlistWriter archiver;
  for (size_t i = 0; i < n; ++i) {
    const SyncEngineChange& change = _changes[i];
    putUInt32At(output, 8 + 4 * i, static_cast<uint32_t>(bodyStart + body.size()));
    NubiloAppendString(body, change.recordIdentifier());
    NubiloAppendUInt32(body, change.type());
    // The archive goes straight into the body; its length is filled in after.
    const size_t lengthAt = body.size();
    NubiloAppendUInt32(body, 0);
    archiver.append(change.changes(), body);
    putUInt32At(body, lengthAt, static_cast<uint32_t>(body.size() - lengthAt - 4));
  }
  putUInt32At(output, 8 + 4 * n, vtc::clog::kIndexEnd);
  if (std::optional<vtc::Bytes> zipped = NubiloGzip(body))
    output.insert(output.end(), zipped->begin(), zipped->end());
}
