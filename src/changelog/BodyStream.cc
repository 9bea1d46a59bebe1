#include "changelog/BodyStream.h"

#include <algorithm>
#include <cstring>

#include "VantorSyncManager/NubiloDataAdditions.h"
#include "changelog/ChangeLogFormat.h"
#include "common/Format.h"
#include "common/Limits.h"

namespace vtc::clog {

namespace {
// A length read from a damaged file must not allocate much more than the
// body really inflates to: the window grows by at most this much at a time.
constexpr size_t kLargestStep = 16 << 20;
}  // namespace

BodyStream::BodyStream(ByteView compressed, Consumed consumed, InflateBudget budget, size_t step)
    : consumed_(std::move(consumed)),
      budget_(budget),
      compressedSize_(compressed.size()),
      step_(step) {
  if (compressed.size() <= 9 || inflateInit2(&z_, -15) != Z_OK)
    corrupt("Failed to unzip changes from clog");
  z_.next_in = const_cast<Bytef*>(compressed.data() + 10);
  z_.avail_in = static_cast<uInt>(compressed.size() - 10);
}

BodyStream::~BodyStream() {
  inflateEnd(&z_);
}

void BodyStream::inflateMore(size_t wanted) {
  const uint64_t inflated = dropped_ + filled_;
  if (inflated > budget_.bytes)
    corrupt(overLimitText(
        format("The inflated body of a changelog of %@", byteCountText(compressedSize_)),
        budget_.bytes, budget_.key));
  if (filled_ == window_.size()) {
    // Never more room than the budget leaves: a length read from a hostile
    // file makes the window grow only as far as the body may inflate.
    const uint64_t left = budget_.bytes - inflated;
    const size_t grow = std::clamp(wanted, step_, std::max(step_, kLargestStep));
    // One byte past the budget at most, to tell that the body goes over it.
    window_.resize(window_.size() + (left < grow ? static_cast<size_t>(left) + 1 : grow));
  }
  z_.next_out = window_.data() + filled_;
  z_.avail_out = static_cast<uInt>(window_.size() - filled_);
  const uint8_t* before = z_.next_in;
  const int ret = inflate(&z_, Z_SYNC_FLUSH);
  filled_ = window_.size() - z_.avail_out;
  consumed_(before, z_.next_in);
  // Input running out before the end of the stream is an error too
  // (Z_BUF_ERROR): the body was cut short.
  if (ret != Z_OK && ret != Z_STREAM_END) corrupt("Failed to unzip changes from clog");
  ended_ = ret == Z_STREAM_END;
}

bool BodyStream::fill(size_t n) {
  if (filled_ - cursor_ >= n) return true;
  if (cursor_ > 0) {  // read bytes are dropped by moving the unread tail to the front
    std::memmove(window_.data(), window_.data() + cursor_, filled_ - cursor_);
    filled_ -= cursor_;
    dropped_ += cursor_;
    cursor_ = 0;
  }
  while (filled_ < n && !ended_) inflateMore(n - filled_);
  return filled_ >= n;
}

std::string BodyStream::readCString() {
  size_t scanned = 0;  // unread bytes already known to hold no zero
  for (;;) {
    if (const size_t unread = filled_ - cursor_; unread > scanned) {
      const uint8_t* start = window_.data() + cursor_;
      if (const void* zero = std::memchr(start + scanned, 0, unread - scanned)) {
        const size_t length = static_cast<const uint8_t*>(zero) - start;
        std::string s(reinterpret_cast<const char*>(start), length);
        cursor_ += length + 1;
        return s;
      }
      scanned = unread;
    }
    if (!fill(scanned + 1)) corrupt("unterminated record identifier in changelog body");
  }
}

uint32_t BodyStream::readUInt32() {
  if (!fill(4)) beyondBounds(dropped_ + filled_, dropped_ + cursor_);
  const uint32_t v = NubiloUInt32AtOffset(ByteView(window_.data() + cursor_, 4), 0);
  cursor_ += 4;
  return v;
}

ByteView BodyStream::read(size_t n) {
  if (!fill(n)) corrupt("record archive beyond the end of changelog data");
  ByteView out(window_.data() + cursor_, n);
  cursor_ += n;
  return out;
}

void BodyStream::finish() {
  while (!ended_) {
    dropped_ += filled_;
    filled_ = cursor_ = 0;
    inflateMore(step_);
  }
}

}  // namespace vtc::clog
