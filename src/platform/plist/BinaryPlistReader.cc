#include "platform/plist/BinaryPlistReader.h"

#include <algorithm>
#include <bit>
#include <cmath>
#include <cstring>

#include "platform/plist/BinaryPlistFormat.h"

namespace vtc::plist {

namespace {

using namespace binary;

// The clock counts nanoseconds in 64 bits, about 290 years either side of
// 1970; dates further out (a "distant future") are held at this bound.
constexpr double kMaxDateSeconds = 8e9;
// Containers are grown as their values are read, room for this many made at
// once: a hostile count is charged, but not allocated before it is read.
constexpr uint64_t kReserveAhead = 4096;

void appendUtf8(std::string& out, uint32_t c) {
  if (c < 0x80) {
    out += static_cast<char>(c);
  } else if (c < 0x800) {
    out += static_cast<char>(0xC0 | c >> 6);
    out += static_cast<char>(0x80 | (c & 0x3F));
  } else if (c < 0x10000) {
    out += static_cast<char>(0xE0 | c >> 12);
    out += static_cast<char>(0x80 | (c >> 6 & 0x3F));
    out += static_cast<char>(0x80 | (c & 0x3F));
  } else {
    out += static_cast<char>(0xF0 | c >> 18);
    out += static_cast<char>(0x80 | (c >> 12 & 0x3F));
    out += static_cast<char>(0x80 | (c >> 6 & 0x3F));
    out += static_cast<char>(0x80 | (c & 0x3F));
  }
}

class Reader {
 public:
  Reader(ByteView bytes, ReadBudget* shared)
      : p_(bytes.data()),
        shared_(shared),
        size_(bytes.size()),
        // A tree-shaped document yields one value per reference it holds,
        // and every reference takes at least a byte. Sharing an object
        // multiplies its values, not without limit.
        refBudget_(2 * bytes.size() + 16),
        byteBudget_(kTextBytesPerByte * bytes.size() + (1 << 20)) {}

  bool open(uint64_t& top) {
    if (size_ < kMagicSize + kTrailerSize || std::memcmp(p_, kMagic, kMagicSize) != 0) return false;
    const uint8_t* t = p_ + size_ - kTrailerSize;
    offsetWidth_ = t[6];
    refWidth_ = t[7];
    count_ = readBigEndian(t + 8, 8);
    top = readBigEndian(t + 16, 8);
    tableAt_ = readBigEndian(t + 24, 8);
    const uint64_t trailerAt = size_ - kTrailerSize;
    return offsetWidth_ >= 1 && offsetWidth_ <= 8 && refWidth_ >= 1 && refWidth_ <= 8 &&
           tableAt_ >= kMagicSize && tableAt_ <= trailerAt &&
           count_ <= (trailerAt - tableAt_) / offsetWidth_ && top < count_;
  }

  // The top object; false when the document is malformed or asks for more
  // work than its size allows.
  bool readTop(uint64_t top, Value& out) { return charge(1) && read(top, 0, out); }

 private:
  // Reads object ref at depth into out; its parent charged the reference.
  bool read(uint64_t ref, unsigned depth, Value& out) {
    size_t at;
    if (!objectAt(ref, at)) return false;
    const uint8_t marker = p_[at++];
    const uint8_t low = marker & 0x0F;
    switch (marker >> 4) {
      case kSimple:
        if (marker == kFalse || marker == kTrue) {
          out = Value(marker == kTrue);
          return true;
        }
        return marker == 0x00;  // null: a none value
      case kInteger: {
        const size_t width = size_t{1} << std::min<uint8_t>(low, 5);
        if (width > 16 || !fits(at, width)) return false;
        // 16-byte integers carry their value in the low half.
        const uint64_t v =
            width == 16 ? readBigEndian(p_ + at + 8, 8) : readBigEndian(p_ + at, width);
        out = Value(static_cast<long long>(v));  // 8 bytes are two's complement
        return true;
      }
      case kReal:
        if (low == 2 && fits(at, 4)) {
          out = Value(static_cast<double>(
              std::bit_cast<float>(static_cast<uint32_t>(readBigEndian(p_ + at, 4)))));
          return true;
        }
        if (low == 3 && fits(at, 8)) {
          out = Value(std::bit_cast<double>(readBigEndian(p_ + at, 8)));
          return true;
        }
        return false;
      case kDate: {
        if (marker != kDateMarker || !fits(at, 8)) return false;
        const double seconds = std::bit_cast<double>(readBigEndian(p_ + at, 8));
        if (std::isnan(seconds)) return false;
        const double held = std::clamp(seconds, -kMaxDateSeconds, kMaxDateSeconds);
        const auto us = std::llround(held * 1e6) + kEpochOffsetSeconds * 1000000;
        out = Value(Date(std::chrono::microseconds(us)));
        return true;
      }
      case kData: {
        uint64_t length;
        if (!lengthAt(at, low, length) || !fits(at, length) || !spend(length, length)) return false;
        out = Value(Bytes(p_ + at, p_ + at + length));
        return true;
      }
      case kAsciiString:
      case kUtf16String: {
        std::string_view text;
        if (!textAt(at, marker, text)) return false;
        out = Value(text);
        return true;
      }
      case kUid:
        return true;  // archiver references mean nothing here: a none value
      case kArray:
      case kSet: {
        uint64_t count;
        if (!lengthAt(at, low, count) || count > (tableAt_ - at) / refWidth_ ||
            !enter(ref, count, depth) || !charge(count))
          return false;
        Array& array = out.mutableArray();
        array.reserve(std::min(count, kReserveAhead));
        for (uint64_t i = 0; i < count; ++i)
          if (!read(refAt(at, i), depth + 1, array.emplace_back())) return false;
        return true;
      }
      case kDictionary: {
        uint64_t count;
        if (!lengthAt(at, low, count) || count > (tableAt_ - at) / refWidth_ / 2 ||
            !enter(ref, count, depth) || !charge(2 * count))
          return false;
        Dictionary& dictionary = out.mutableDictionary();
        dictionary.reserve(std::min(count, kReserveAhead));
        for (uint64_t i = 0; i < count; ++i) {
          std::string_view key;
          if (!keyAt(refAt(at, i), key)) return false;
          // A repeated key keeps its first place and its last value.
          const size_t before = dictionary.size();
          Value& value = dictionary.slot(key);
          if (dictionary.size() == before) value = Value();
          if (!read(refAt(at, count + i), depth + 1, value)) return false;
        }
        return true;
      }
      default:
        return false;
    }
  }

  bool fits(size_t at, uint64_t length) const { return length <= tableAt_ - at; }

  // Takes n references from the budget before the values they yield are built.
  bool charge(uint64_t n) {
    if (n > refBudget_) return false;
    refBudget_ -= n;
    return !shared_ || shared_->spend(n * ReadBudget::kValueCost);
  }

  // Puts container ref, holding count references, on the path at depth. One
  // already on the path above has led back to itself: the cycle is refused
  // where it first closes, before any more is built.
  bool enter(uint64_t ref, uint64_t count, unsigned depth) {
    if (depth >= kMaxDepth && count > 0) return false;  // its values would be too deep
    for (unsigned k = 0; k < depth; ++k)
      if (path_[k] == ref) return false;
    path_[depth] = ref;
    return true;
  }

  // Takes the most that text or data of n bytes may cost from this
  // document's budget, and what it does cost from the shared one.
  bool spend(uint64_t most, uint64_t costs) {
    if (most > byteBudget_) return false;
    byteBudget_ -= most;
    return !shared_ || shared_->spend(costs);
  }

  // Where object ref starts; objects lie between the magic and the table.
  bool objectAt(uint64_t ref, size_t& at) const {
    if (ref >= count_) return false;
    const uint64_t offset = readBigEndian(p_ + tableAt_ + ref * offsetWidth_, offsetWidth_);
    if (offset < kMagicSize || offset >= tableAt_) return false;
    at = static_cast<size_t>(offset);
    return true;
  }

  uint64_t refAt(size_t at, uint64_t i) const {
    return readBigEndian(p_ + at + i * refWidth_, refWidth_);
  }

  // The length in the marker's low nibble, or in the integer object after it.
  bool lengthAt(size_t& at, uint8_t low, uint64_t& length) const {
    if (low != kLengthFollows) {
      length = low;
      return true;
    }
    if (!fits(at, 1) || (p_[at] >> 4) != kInteger || (p_[at] & 0x0F) > 3) return false;
    const size_t width = size_t{1} << (p_[at] & 0x0F);
    if (!fits(at + 1, width)) return false;
    length = readBigEndian(p_ + at + 1, width);
    at += 1 + width;
    return true;
  }

  bool keyAt(uint64_t ref, std::string_view& key) {
    size_t at;
    if (!objectAt(ref, at)) return false;
    const uint8_t marker = p_[at++];
    const uint8_t kind = marker >> 4;
    return (kind == kAsciiString || kind == kUtf16String) && textAt(at, marker, key);
  }

  // The text of the string object whose marker precedes at, as UTF-8: plain
  // ASCII is viewed in place, anything else decoded into text_. The view
  // lasts until the next string is read.
  bool textAt(size_t at, uint8_t marker, std::string_view& text) {
    uint64_t length;
    if (!lengthAt(at, marker & 0x0F, length)) return false;
    const uint8_t* s = p_ + at;
    std::string& decoded = text_;
    if ((marker >> 4) == kAsciiString) {
      if (!fits(at, length)) return false;
      const bool ascii = isAscii(s, length);
      if (!spend(3 * length, ascii ? length : 3 * length)) return false;
      if (ascii) {
        text = std::string_view(reinterpret_cast<const char*>(s), length);
        return true;
      }
      // Bytes past ASCII have no agreed meaning here; like malformed text
      // elsewhere they read as U+FFFD, so every string read is valid UTF-8.
      decoded.clear();
      for (uint64_t i = 0; i < length; ++i) appendUtf8(decoded, s[i] < 0x80 ? s[i] : 0xFFFD);
      text = decoded;
      return true;
    }
    if (length > (tableAt_ - at) / 2 || !spend(3 * length, 3 * length)) return false;
    decoded.clear();
    decoded.reserve(length);
    for (uint64_t i = 0; i < length; ++i) {
      uint32_t c = static_cast<uint32_t>(s[2 * i] << 8 | s[2 * i + 1]);
      if (c >= 0xD800 && c <= 0xDFFF) {
        uint32_t next =
            i + 1 < length ? static_cast<uint32_t>(s[2 * i + 2] << 8 | s[2 * i + 3]) : 0;
        if (c <= 0xDBFF && next >= 0xDC00 && next <= 0xDFFF) {
          c = 0x10000 + ((c - 0xD800) << 10) + (next - 0xDC00);
          ++i;
        } else {
          c = 0xFFFD;  // an unpaired surrogate
        }
      }
      appendUtf8(decoded, c);
    }
    text = decoded;
    return true;
  }

  const uint8_t* p_;
  ReadBudget* shared_;
  size_t size_;
  std::string text_;              // decoded text, reused
  uint64_t path_[kMaxDepth + 1];  // the containers from the top down to the one being read
  uint64_t refBudget_;
  uint64_t byteBudget_;
  size_t offsetWidth_ = 0;
  size_t refWidth_ = 0;
  uint64_t count_ = 0;
  uint64_t tableAt_ = 0;
};

}  // namespace

std::optional<Value> parseBinary(ByteView bytes, ReadBudget* shared) {
  Reader reader(bytes, shared);
  uint64_t top;
  Value value;
  if (!reader.open(top) || !reader.readTop(top, value)) return std::nullopt;
  return value;
}

}  // namespace vtc::plist
