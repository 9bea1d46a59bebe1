// The changelog reader. The compressed body is inflated in steps and parsed
// record by record, so memory follows the decoded records, not the body; the
// body's inflated size and the decoded records' memory are both held to a
// budget derived from the changelog's size (common/Limits.h).
#include <cstring>
#include <new>

#include "VantorSyncManager/NubiloChangeLog.h"
#include "VantorSyncManager/NubiloDataAdditions.h"
#include "VantorSyncManager/NubiloException.h"
#include "changelog/BodyStream.h"
#include "changelog/ChangeLogFormat.h"
#include "common/Limits.h"
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

// Texts from the file are quoted this long at most: a changelog must not
// make the log grow by its own size.
constexpr size_t kQuoted = 512;

std::string failureText(const std::exception& e) {
  if (auto* n = dynamic_cast<const NubiloException*>(&e)) return vtc::clipped(n->reason(), kQuoted);
  return vtc::clipped(e.what(), kQuoted);
}

vtc::clog::InflateBudget inflateBudget(size_t compressed) {
  const vtc::Limits& l = vtc::limits();
  const uint64_t bytes = l.inflateBudget(compressed);
  return {bytes,
          bytes < l.inflatedBytes ? vtc::Limits::kInflateRatioKey : vtc::Limits::kInflatedKey};
}

}  // namespace

void NubiloChangeLog::inputConsumed(const uint8_t*, const uint8_t*) {}

void NubiloChangeLog::parseData(vtc::ByteView data) {
  if (data.empty()) {
    VTC_LOG_ERROR(
        "Attempting to initialize ChangeLog with no Data, initializing with no changes "
        "instead");
    _changes.clear();
    _refusedChanges.clear();
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
  std::vector<vtc::RefusedChange> refused;
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
      if (eq == std::string::npos)
        corrupt("header line without \"=\": " + vtc::clipped(line, kQuoted));
      size_t second = line.find('=', eq + 1);  // text after a second "=" is dropped
      headers->set(line.substr(0, eq), vtc::Value(line.substr(eq + 1, second - eq - 1)));
      at += line.size() + 1;
    }

    if (count > 0) {
      if (bodyStart > data.size()) corrupt("body beyond the end of changelog data");
      vtc::clog::BodyStream body(
          data.subspan(bodyStart),
          [this](const uint8_t* b, const uint8_t* e) { inputConsumed(b, e); },
          inflateBudget(data.size()));
      const uint64_t allowed = vtc::limits().decodeBudget(data.size());
      vtc::plist::ReadBudget memory{allowed};
      // Room is made as records are read: the count is the file's claim.
      changes.reserve(std::min<size_t>(count, 4096));
      for (uint32_t i = 0; i < count; ++i) {
        std::string identifier = body.readCString();
        uint32_t type = body.readUInt32();
        uint32_t length = body.readUInt32();
        // Each archive has its length before it: one that cannot be read is
        // passed over by itself, the records after it are read.
        memory.spend(sizeof(SyncEngineChange) + identifier.size());
        std::optional<vtc::Value> archived = vtc::plist::parse(body.read(length), &memory);
        if (memory.exhausted)
          corrupt(vtc::overLimitText(vtc::format("The decoded changes of a changelog of %@",
                                                 vtc::byteCountText(data.size())),
                                     allowed, vtc::Limits::kDecodedKey));
        if (!archived || !archived->isArray()) {
          refused.push_back({i, vtc::clipped(identifier, kQuoted),
                             archived ? "its archive is not a list of changes"
                                      : "its archive is not a property list that can be read "
                                        "within its size"});
          continue;
        }
        changes.emplace_back(type, std::move(identifier), std::move(archived->mutableArray()));
      }
      body.finish();
    }
    _version = version;
  } catch (const std::bad_alloc&) {
    // Memory this computer could not give is no damage of the changelog.
    clearCrashFlagForHash(hash);
    throw;
  } catch (const std::exception& e) {
    clearCrashFlagForHash(hash);
    VTC_LOG_ERROR("Exception caught while trying to process changelog %@ \n Headers:%@",
                  failureText(e), vtc::clipped(vtc::textOf(headers), kQuoted));
    throw NubiloException(
        NubiloCorruptChangelogException,
        vtc::format("Exception trying to decode changelog %@, Headers:", failureText(e)));
  }
  for (const vtc::RefusedChange& r : refused)
    VTC_LOG_WARNING("Record %d (%@) of a changelog was passed over: %@", r.position,
                    r.recordIdentifier, r.reason);
  _headers = std::move(headers);
  _changes = std::move(changes);
  _refusedChanges = std::move(refused);
  clearCrashFlagForHash(hash);
}
