// The changelog reader. The compressed body is inflated in steps and parsed
// record by record, so memory follows the decoded records, not the body.
#include <cstring>

#include "VantorSyncManager/NubiloChangeLog.h"
#include "VantorSyncManager/NubiloDataAdditions.h"
#include "VantorSyncManager/NubiloException.h"
#include "changelog/BodyStream.h"
#include "changelog/ChangeLogFormat.h"
#include "common/Logging.h"
#include "platform/plist/PlistCodec.h"

namespace {

using vtc::clog::corrupt;

// The zero-terminated string at offset, bounded by the end of data.
std::string cString(vtc::ByteView data, size_t offset) {
  if (offset >= data.size()) corrupt("string beyond the end of changelog data");
  const uint8_t* start = data.data() + offset;
  const void* zero = std::memchr(start, 0, data.size() - offset);
  if (!zero) corrupt("unterminated string in changelog data");
  return std::string(reinterpret_cast<const char*>(start),
                     static_cast<const uint8_t*>(zero) - start);
}

std::string failureText(const std::exception& e) {
  if (auto* n = dynamic_cast<const NubiloException*>(&e)) return n->reason();
  return e.what();
}

}  // namespace

void NubiloChangeLog::inputConsumed(const uint8_t*, const uint8_t*) {}

void NubiloChangeLog::parseData(vtc::ByteView data) {
  if (data.empty()) {
    VTC_LOG_ERROR(
        "Attempting to initialize ChangeLog with no Data, initializing with no changes "
        "instead");
    _changes.clear();
    clearCrashFlagForHash(0);
    return;
  }
  // Hashed in steps, each step's input handed back when done with.
  uint64_t hash = vtc::clog::kHashSeed;
  constexpr size_t kHashStep = 8 << 20;
  for (size_t at = 0; at < data.size(); at += kHashStep) {
    vtc::ByteView step = data.subspan(at, std::min(kHashStep, data.size() - at));
    hash = vtc::clog::stableHash(step, hash);
    inputConsumed(step.data(), step.data() + step.size());
  }
  // Decoded into locals and kept only when all is read: a failure changes
  // nothing, and its Error line shows only the headers of these bytes.
  std::optional<vtc::Dictionary> headers;
  std::vector<SyncEngineChange> changes;
  try {
    setCrashFlagForHash(hash);
    const uint32_t version = NubiloUInt32AtOffset(data, 0);
    const uint32_t headerStart = NubiloUInt32AtOffset(data, 4);
    const uint32_t bodyStart = NubiloUInt32AtOffset(data, 8);
    // The index takes at least 12 bytes; a smaller offset would wrap the count.
    if (headerStart < 12) corrupt(vtc::format("header offset %u inside the index", headerStart));
    const uint32_t count = headerStart / 4 - 3;

    headers = vtc::Dictionary{};
    for (size_t at = headerStart;;) {
      std::string line = cString(data, at);
      if (line == vtc::clog::kHeaderEnd) break;
      size_t eq = line.find('=');
      if (eq == std::string::npos) corrupt("header line without \"=\": " + line);
      size_t second = line.find('=', eq + 1);  // text after a second "=" is dropped
      headers->set(line.substr(0, eq), vtc::Value(line.substr(eq + 1, second - eq - 1)));
      at += line.size() + 1;
    }

    if (count > 0) {
      if (bodyStart > data.size()) corrupt("body beyond the end of changelog data");
      vtc::clog::BodyStream body(
          data.subspan(bodyStart),
          [this](const uint8_t* b, const uint8_t* e) { inputConsumed(b, e); });
      // Room is made as records are read: the count is the file's claim.
      changes.reserve(std::min<size_t>(count, 4096));
      for (uint32_t i = 0; i < count; ++i) {
        std::string identifier = body.readCString();
        uint32_t type = body.readUInt32();
        uint32_t length = body.readUInt32();
        std::optional<vtc::Value> archived = vtc::plist::parse(body.read(length));
        if (!archived || !archived->isArray()) corrupt("record archive is not a list of changes");
        changes.emplace_back(type, std::move(identifier), std::move(archived->mutableArray()));
      }
      body.finish();
    }
    _version = version;
  } catch (const std::exception& e) {
    clearCrashFlagForHash(hash);
    VTC_LOG_ERROR("Exception caught while trying to process changelog %@ \n Headers:%@",
                  failureText(e), headers);
    throw NubiloException(
        NubiloCorruptChangelogException,
        vtc::format("Exception trying to decode changelog %@, Headers:", failureText(e)));
  }
  _headers = std::move(headers);
  _changes = std::move(changes);
  clearCrashFlagForHash(hash);
}
