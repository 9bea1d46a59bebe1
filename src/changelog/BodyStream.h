// A changelog's compressed body read as a stream of records: the reduced gzip
// envelope's first ten bytes are skipped and the raw deflate stream inflated
// on demand into one window that is reused, so memory follows the record
// being read, not the body. The body may inflate to a budget of bytes, no
// more. Every failure raises NubiloCorruptChangelogException. Not
// thread-safe.
#pragma once

#include <zlib.h>

#include <cstdint>
#include <functional>
#include <string>

#include "VantorSyncManager/Value.h"

namespace vtc::clog {

// What a body may inflate to, and the configuration key that sets it.
struct InflateBudget {
  uint64_t bytes = UINT64_MAX;
  const char* key = "";
};

class BodyStream {
 public:
  // Told which compressed bytes each inflate step used up.
  using Consumed = std::function<void(const uint8_t*, const uint8_t*)>;
  // Small: bytes already read are dropped, so the window holds one record
  // at a time, and most changelogs are a few kilobytes.
  static constexpr size_t kStep = 64 << 10;

  // step: how much the window grows at a time.
  BodyStream(ByteView compressed, Consumed consumed, InflateBudget budget = {},
             size_t step = kStep);
  ~BodyStream();
  BodyStream(const BodyStream&) = delete;
  BodyStream& operator=(const BodyStream&) = delete;

  // A zero-terminated string; each inflated byte is looked at once.
  std::string readCString();
  // A big-endian word; beyond the end of the body it raises the bounds
  // failure of NubiloUInt32AtOffset, with the body's length and the offset.
  uint32_t readUInt32();
  // The next n bytes, valid until the next read.
  ByteView read(size_t n);
  // Inflates and drops whatever follows the last record: a body whose deflate
  // stream does not reach its end is cut short, and refused.
  void finish();

 private:
  // Makes at least n unread bytes available; false when the body ends first.
  bool fill(size_t n);
  // One inflate step into the free end of the window.
  void inflateMore(size_t wanted);

  Consumed consumed_;
  const InflateBudget budget_;
  const uint64_t compressedSize_;
  const size_t step_;
  z_stream z_{};
  bool ended_ = false;  // the deflate stream reached its end
  Bytes window_;
  size_t filled_ = 0;     // inflated bytes in the window
  size_t cursor_ = 0;     // next unread byte
  uint64_t dropped_ = 0;  // inflated bytes moved out of the window before it
};

}  // namespace vtc::clog
