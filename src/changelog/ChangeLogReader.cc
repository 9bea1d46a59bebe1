// The changelog reader. The compressed body is inflated in steps and parsed
// record by record, so memory follows the decoded records, not the body.
#include <zlib.h>

#include <cstring>
#include <functional>

#include "VantorSyncManager/NubiloChangeLog.h"
#include "VantorSyncManager/NubiloDataAdditions.h"
#include "VantorSyncManager/NubiloException.h"
#include "VantorSyncManager/PublicNames.h"
#include "changelog/ChangeLogFormat.h"
#include "common/Logging.h"
#include "platform/plist/PlistCodec.h"

namespace {

[[noreturn]] void corrupt(const std::string& reason) {
  throw NubiloException(NubiloCorruptChangelogException, reason);
}

// The zero-terminated string at offset, bounded by the end of data.
std::string cString(vtc::ByteView data, size_t offset) {
  if (offset >= data.size()) corrupt("string beyond the end of changelog data");
  const uint8_t* start = data.data() + offset;
  const void* zero = std::memchr(start, 0, data.size() - offset);
  if (!zero) corrupt("unterminated string in changelog data");
  return std::string(reinterpret_cast<const char*>(start),
                     static_cast<const uint8_t*>(zero) - start);
}

// The decompressed body as a stream: the reduced gzip envelope's first ten
// bytes are skipped, the raw deflate stream inflated on demand.
class BodyStream {
 public:
  using Consumed = std::function<void(const uint8_t*, const uint8_t*)>;
  BodyStream(vtc::ByteView compressed, Consumed consumed) : consumed_(std::move(consumed)) {
    if (compressed.size() <= 9 || inflateInit2(&z_, -15) != Z_OK)
      corrupt("Failed to unzip changes from clog");
    open_ = true;
    z_.next_in = const_cast<Bytef*>(compressed.data() + 10);
    z_.avail_in = static_cast<uInt>(compressed.size() - 10);
  }
  ~BodyStream() {
    if (open_) inflateEnd(&z_);
  }

  // Makes at least n unread bytes available; false when the body ends first.
  // The body is inflated into one window that is reused: read bytes are
  // dropped by moving the unread tail to the front.
  bool fill(size_t n) {
    if (filled_ - cursor_ >= n) return true;
    if (cursor_ > 0) {
      std::memmove(window_.data(), window_.data() + cursor_, filled_ - cursor_);
      filled_ -= cursor_;
      cursor_ = 0;
    }
    while (filled_ < n && !ended_) {
      if (filled_ == window_.size()) {
        // Grown in bounded steps: a length read from a damaged file must not
        // allocate more than the body really inflates to.
        window_.resize(window_.size() + std::clamp<size_t>(n - filled_, kWindow, 16 << 20));
      }
      z_.next_out = window_.data() + filled_;
      z_.avail_out = static_cast<uInt>(window_.size() - filled_);
      const uint8_t* before = z_.next_in;
      int ret = inflate(&z_, Z_SYNC_FLUSH);
      filled_ = window_.size() - z_.avail_out;
      consumed_(before, z_.next_in);
      if (ret < 0) corrupt("Failed to unzip changes from clog");
      if (ret != Z_OK) ended_ = true;
    }
    return filled_ - cursor_ >= n;
  }

  std::string readCString() {
    for (size_t have = 1;; have = filled_ - cursor_ + 1) {
      if (!fill(have)) corrupt("unterminated record identifier in changelog body");
      const uint8_t* start = window_.data() + cursor_;
      if (const void* zero = std::memchr(start, 0, filled_ - cursor_)) {
        size_t len = static_cast<const uint8_t*>(zero) - start;
        std::string s(reinterpret_cast<const char*>(start), len);
        cursor_ += len + 1;
        return s;
      }
    }
  }

  uint32_t readUInt32() {
    if (!fill(4)) corrupt("record header beyond the end of changelog data");
    uint32_t v = NubiloUInt32AtOffset(vtc::ByteView(window_.data() + cursor_, 4), 0);
    cursor_ += 4;
    return v;
  }

  // The next n bytes, valid until the next read.
  vtc::ByteView read(size_t n) {
    if (!fill(n)) corrupt("record archive beyond the end of changelog data");
    vtc::ByteView out(window_.data() + cursor_, n);
    cursor_ += n;
    return out;
  }

 private:
  Consumed consumed_;
  z_stream z_{};
  bool open_ = false;
  bool ended_ = false;
  static constexpr size_t kWindow = 1 << 20;
  vtc::Bytes window_;
  size_t filled_ = 0;  // inflated bytes in the window
  size_t cursor_ = 0;  // next unread byte
};

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
  try {
    setCrashFlagForHash(hash);
    _version = NubiloUInt32AtOffset(data, 0);
    const uint32_t headerStart = NubiloUInt32AtOffset(data, 4);
    const uint32_t bodyStart = NubiloUInt32AtOffset(data, 8);
    const uint32_t count = headerStart / 4 - 3;  // unsigned, as written

    _headers = vtc::Dictionary{};
    for (size_t at = headerStart;;) {
      std::string line = cString(data, at);
      if (line == vtc::clog::kHeaderEnd) break;
      size_t eq = line.find('=');
      if (eq == std::string::npos) corrupt("header line without \"=\": " + line);
      size_t second = line.find('=', eq + 1);  // text after a second "=" is dropped
      _headers->set(line.substr(0, eq), vtc::Value(line.substr(eq + 1, second - eq - 1)));
      at += line.size() + 1;
    }

    _changes.clear();
    if (count > 0) {
      if (bodyStart > data.size()) corrupt("body beyond the end of changelog data");
      BodyStream body(data.subspan(bodyStart),
                      [this](const uint8_t* b, const uint8_t* e) { inputConsumed(b, e); });
      _changes.reserve(std::min<size_t>(count, data.size()));
      for (uint32_t i = 0; i < count; ++i) {
        std::string identifier = body.readCString();
        uint32_t type = body.readUInt32();
        uint32_t length = body.readUInt32();
        std::optional<vtc::Value> archived = vtc::plist::parse(body.read(length));
        if (!archived || !archived->isArray()) corrupt("record archive is not a list of changes");
        _changes.emplace_back(type, std::move(identifier), std::move(archived->mutableArray()));
      }
    }
  } catch (const std::exception& e) {
    clearCrashFlagForHash(hash);
    VTC_LOG_ERROR("Exception caught while trying to process changelog %@ \n Headers:%@",
                  failureText(e), _headers.value_or(vtc::Dictionary{}));
    throw NubiloException(
        NubiloCorruptChangelogException,
        vtc::format("Exception trying to decode changelog %@, Headers:", failureText(e)));
  }
  clearCrashFlagForHash(hash);
}
