// The changelog writer: index, headers, then the compressed body.
#include <cstring>
#include <ctime>
#include <stdexcept>
#include <string>
#include <vector>

#include "VantorSyncManager/NubiloChangeLog.h"
#include "VantorSyncManager/NubiloDataAdditions.h"
#include "changelog/ChangeLogFormat.h"
#include "common/Clock.h"
#include "common/Format.h"
#include "common/Limits.h"
#include "platform/plist/BinaryPlistWriter.h"

namespace {

void putUInt32At(vtc::Bytes& out, size_t offset, uint32_t v) {
  out[offset] = static_cast<uint8_t>(v >> 24);
  out[offset + 1] = static_cast<uint8_t>(v >> 16);
  out[offset + 2] = static_cast<uint8_t>(v >> 8);
  out[offset + 3] = static_cast<uint8_t>(v);
}

}  // namespace

namespace vtc::clog {

std::string creationTimestamp() {
  std::time_t t = std::chrono::system_clock::to_time_t(vtc::currentClock().now());
  std::tm tm{};
  localtime_r(&t, &tm);
  char buf[32];
  std::strftime(buf, sizeof buf, "%m/%d/%y %H:%M:%S", &tm);
  return buf;
}

const std::string& textWithoutZero(const std::string& text, const char* what) {
  if (text.find('\0') != std::string::npos)
    throw std::invalid_argument(std::string("Cannot write a changelog ") + what +
                                " holding a zero byte: readers would cut it there");
  return text;
}

std::vector<std::string> headerLines(const Dictionary& headers) {
  std::vector<std::string> lines;
  lines.reserve(headers.size());
  for (const auto& [key, value] : headers)
    lines.push_back(textWithoutZero(vtc::format("%@=%@", key, value), "header"));
  return lines;
}

}  // namespace vtc::clog

using vtc::clog::creationTimestamp;
using vtc::clog::textWithoutZero;

void NubiloChangeLog::writeToData(vtc::Bytes& output) {
  // The body and the header lines are made first: what every reader would
  // refuse is refused here, before output is touched.
  const size_t n = _changes.size();
  vtc::Bytes body;
  std::vector<size_t> recordAt(n);
  vtc::plist::BinaryPlistWriter archiver;
  for (size_t i = 0; i < n; ++i) {
    const SyncEngineChange& change = _changes[i];
    recordAt[i] = body.size();
    NubiloAppendString(body, textWithoutZero(change.recordIdentifier(), "record identifier"));
    NubiloAppendUInt32(body, change.type());
    // The archive goes straight into the body; its length is filled in after.
    const size_t lengthAt = body.size();
    NubiloAppendUInt32(body, 0);
    archiver.append(change.changes(), body);  // refuses nesting readers refuse
    putUInt32At(body, lengthAt, static_cast<uint32_t>(body.size() - lengthAt - 4));
  }

  // Set directly: a mapped changelog refuses header changes from callers.
  if (!_headers) _headers = vtc::Dictionary{};
  _headers->set("CreationTimestamp", vtc::Value(creationTimestamp()));
  const std::vector<std::string> lines = vtc::clog::headerLines(*_headers);

  // A body that inflates beyond what readers of a file this size take
  // would be refused by every other computer.
  std::optional<vtc::Bytes> zipped = NubiloGzip(body);
  size_t fileSize =
      12 + 4 * n + std::strlen(vtc::clog::kHeaderEnd) + 1 + (zipped ? zipped->size() : 0);
  for (const std::string& line : lines) fileSize += line.size() + 1;
  if (body.size() > vtc::limits().inflateBudget(fileSize))
    throw std::invalid_argument(vtc::format(
        "Cannot write a changelog whose records inflate from %@ to %@: readers refuse more than "
        "%d times a changelog's size",
        vtc::byteCountText(fileSize), vtc::byteCountText(body.size()), vtc::limits().inflateRatio));

  // The index is written in place: format number, header offset, one entry
  // per record, then the end marker.
  const size_t indexSize = 12 + 4 * n;
  output.assign(indexSize, 0);
  putUInt32At(output, 0, vtc::clog::kFormatNumber);
  putUInt32At(output, 4, static_cast<uint32_t>(indexSize));
  for (const std::string& line : lines) NubiloAppendString(output, line);
  NubiloAppendString(output, vtc::clog::kHeaderEnd);
  const size_t bodyStart = output.size();
  for (size_t i = 0; i < n; ++i)
    putUInt32At(output, 8 + 4 * i, static_cast<uint32_t>(bodyStart + recordAt[i]));
  putUInt32At(output, 8 + 4 * n, vtc::clog::kIndexEnd);
  if (zipped) output.insert(output.end(), zipped->begin(), zipped->end());
}
