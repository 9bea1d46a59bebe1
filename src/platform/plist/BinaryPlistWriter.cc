#include "platform/plist/BinaryPlistWriter.h"

#include <bit>
#include <cstring>
#include <functional>
#include <stdexcept>
#include <string>
#include <string_view>

#include "common/Utf8.h"
#include "platform/plist/BinaryPlistFormat.h"

namespace vtc::plist {

namespace {

using namespace binary;

size_t widthFor(uint64_t max) {
  if (max <= 0xFF) return 1;
  if (max <= 0xFFFF) return 2;
  if (max <= 0xFFFFFFFF) return 4;
  return 8;
}

void putBigEndian(Bytes& out, uint64_t v, size_t width) {
  size_t at = out.size();
  out.resize(at + width);
  for (size_t i = width; i-- > 0; v >>= 8) out[at + i] = static_cast<uint8_t>(v);
}

void putMarker(Bytes& out, uint8_t kind, uint64_t length) {
  if (length < kLengthFollows) {
    out.push_back(static_cast<uint8_t>(kind << 4 | length));
    return;
  }
  out.push_back(static_cast<uint8_t>(kind << 4 | kLengthFollows));
  size_t width = widthFor(length);
  out.push_back(static_cast<uint8_t>(kInteger << 4 | std::countr_zero(width)));
  putBigEndian(out, length, width);
}

void putInteger(Bytes& out, int64_t v) {
  // Non-negative values take the narrowest of 1, 2 or 4 unsigned bytes;
  // everything else is 8 bytes of two's complement.
  size_t width = v < 0 ? 8 : widthFor(static_cast<uint64_t>(v));
  out.push_back(static_cast<uint8_t>(kInteger << 4 | std::countr_zero(width)));
  putBigEndian(out, static_cast<uint64_t>(v), width);
}

void putDouble(Bytes& out, uint8_t marker, double d) {
  out.push_back(marker);
  putBigEndian(out, std::bit_cast<uint64_t>(d), 8);
}

double secondsSinceReferenceDate(Date date) {
  // Whole microseconds, the precision the readers keep.
  auto us = std::chrono::floor<std::chrono::microseconds>(date.time_since_epoch()).count();
  return static_cast<double>(us - kEpochOffsetSeconds * 1000000) / 1e6;
}

// UTF-8 to UTF-16 code units; each byte of a malformed sequence becomes U+FFFD.
void toUtf16(std::string_view s, std::vector<uint16_t>& units) {
  units.clear();
  const auto* p = reinterpret_cast<const uint8_t*>(s.data());
  const auto* end = p + s.size();
  while (p < end) {
    char32_t c;
    const size_t length = utf8::decode(p, end, c);
    if (length == 0) {
      units.push_back(0xFFFD);
      ++p;
      continue;
    }
    p += length;
    if (c < 0x10000) {
      units.push_back(static_cast<uint16_t>(c));
    } else {
      c -= 0x10000;
      units.push_back(static_cast<uint16_t>(0xD800 | c >> 10));
      units.push_back(static_cast<uint16_t>(0xDC00 | (c & 0x3FF)));
    }
  }
}

}  // namespace

void BinaryPlistWriter::append(const Value& value, Bytes& out) {
  if (value.isNone()) return;
  begin();
  add(value, 0);
  finish(out);
}

void BinaryPlistWriter::append(const Array& array, Bytes& out) {
  begin();
  addArray(array, 0);
  finish(out);
}

void BinaryPlistWriter::begin() {
  objects_.clear();
  refs_.clear();
  stringCount_ = 0;
  if (++generation_ == 0) {  // wrapped: forget every slot for real
    for (Slot& slot : strings_) slot.generation = 0;
    generation_ = 1;
  }
  if (strings_.empty()) strings_.resize(64);
}

uint32_t BinaryPlistWriter::add(const Value& value, unsigned depth) {
  switch (value.kind()) {
    case Value::Kind::String:
      return addString(value.string());
    case Value::Kind::Array:
      return addArray(value.array(), depth);
    case Value::Kind::Dictionary:
      return addDictionary(value.dictionary(), depth);
    default:
      objects_.push_back({Shape::Scalar, &value, 0, 0});
      return static_cast<uint32_t>(objects_.size() - 1);
  }
}

uint32_t BinaryPlistWriter::addString(const std::string& s) {
  if (s.size() > kMaxSharedStringBytes) {  // written where it occurs: see kTextBytesPerByte
    objects_.push_back({Shape::String, &s, 0, 0});
    return static_cast<uint32_t>(objects_.size() - 1);
  }
  const size_t hash = std::hash<std::string_view>{}(s);
  const size_t mask = strings_.size() - 1;
  for (size_t i = hash & mask;; i = (i + 1) & mask) {
    Slot& slot = strings_[i];
    if (slot.generation != generation_) {
      const auto id = static_cast<uint32_t>(objects_.size());
      objects_.push_back({Shape::String, &s, 0, 0});
      slot = {hash, id, generation_};
      if (++stringCount_ * 2 > strings_.size()) growStringTable();
      return id;
    }
    if (slot.hash == hash && *static_cast<const std::string*>(objects_[slot.id].source) == s)
      return slot.id;
  }
}

void BinaryPlistWriter::growStringTable() {
  std::vector<Slot> old(strings_.size() * 2);
  old.swap(strings_);
  const size_t mask = strings_.size() - 1;
  for (const Slot& slot : old) {
    if (slot.generation != generation_) continue;
    size_t i = slot.hash & mask;
    while (strings_[i].generation == generation_) i = (i + 1) & mask;
    strings_[i] = slot;
  }
}

void BinaryPlistWriter::checkDepth(unsigned depth, size_t children) {
  if (depth >= kMaxDepth && children > 0)
    throw std::invalid_argument("Cannot write a property list nested deeper than " +
                                std::to_string(kMaxDepth) + " levels: readers refuse it");
}

uint32_t BinaryPlistWriter::addArray(const Array& array, unsigned depth) {
  const auto id = static_cast<uint32_t>(objects_.size());
  uint32_t count = 0;
  for (const Value& item : array) count += item.isNone() ? 0 : 1;
  checkDepth(depth, count);
  const auto at = static_cast<uint32_t>(refs_.size());
  objects_.push_back({Shape::Array, &array, at, count});
  refs_.resize(at + count);  // filled below; nested containers append after it
  uint32_t k = at;
  for (const Value& item : array)
    if (!item.isNone()) {
      uint32_t child = add(item, depth + 1);
      refs_[k++] = child;
    }
  return id;
}

uint32_t BinaryPlistWriter::addDictionary(const Dictionary& dictionary, unsigned depth) {
  const auto id = static_cast<uint32_t>(objects_.size());
  uint32_t count = 0;
  for (const auto& entry : dictionary) count += entry.second.isNone() ? 0 : 1;
  checkDepth(depth, count);
  const auto at = static_cast<uint32_t>(refs_.size());
  objects_.push_back({Shape::Dictionary, &dictionary, at, count});
  refs_.resize(at + 2 * size_t{count});  // all keys, then all values
  uint32_t k = at;
  for (const auto& [key, item] : dictionary)
    if (!item.isNone()) {
      uint32_t child = addString(key);
      refs_[k++] = child;
    }
  for (const auto& [key, item] : dictionary)
    if (!item.isNone()) {
      uint32_t child = add(item, depth + 1);
      refs_[k++] = child;
    }
  return id;
}

void BinaryPlistWriter::finish(Bytes& out) {
  const size_t start = out.size();
  refWidth_ = widthFor(objects_.size());
  out.insert(out.end(), kMagic, kMagic + kMagicSize);
  offsets_.clear();
  for (const Object& object : objects_) {
    offsets_.push_back(out.size() - start);
    writeObject(object, out);
  }
  const uint64_t tableAt = out.size() - start;
  const size_t offsetWidth = widthFor(tableAt);
  out.reserve(out.size() + offsets_.size() * offsetWidth + kTrailerSize);
  for (uint64_t offset : offsets_) putBigEndian(out, offset, offsetWidth);
  out.insert(out.end(), 6, 0);  // unused bytes and the sort version
  out.push_back(static_cast<uint8_t>(offsetWidth));
  out.push_back(static_cast<uint8_t>(refWidth_));
  putBigEndian(out, objects_.size(), 8);
  putBigEndian(out, 0, 8);  // the top object comes first
  putBigEndian(out, tableAt, 8);
}

void BinaryPlistWriter::writeObject(const Object& object, Bytes& out) {
  switch (object.shape) {
    case Shape::String: {
      const auto& s = *static_cast<const std::string*>(object.source);
      if (isAscii(reinterpret_cast<const uint8_t*>(s.data()), s.size())) {
        putMarker(out, kAsciiString, s.size());
        out.insert(out.end(), s.begin(), s.end());
        return;
      }
      toUtf16(s, units_);
      putMarker(out, kUtf16String, units_.size());
      size_t at = out.size();
      out.resize(at + 2 * units_.size());
      for (uint16_t unit : units_) {
        out[at++] = static_cast<uint8_t>(unit >> 8);
        out[at++] = static_cast<uint8_t>(unit);
      }
      return;
    }
    case Shape::Array:
    case Shape::Dictionary: {
      putMarker(out, object.shape == Shape::Array ? kArray : kDictionary, object.count);
      const size_t refs = object.shape == Shape::Array ? object.count : 2 * size_t{object.count};
      for (size_t i = 0; i < refs; ++i) putBigEndian(out, refs_[object.refs + i], refWidth_);
      return;
    }
    case Shape::Scalar:
      break;
  }
  const auto& value = *static_cast<const Value*>(object.source);
  switch (value.kind()) {
    case Value::Kind::Integer:
      putInteger(out, value.integer());
      return;
    case Value::Kind::Real:
      putDouble(out, kDoubleMarker, value.real());
      return;
    case Value::Kind::Boolean:
      out.push_back(value.boolean() ? kTrue : kFalse);
      return;
    case Value::Kind::Date:
      putDouble(out, kDateMarker, secondsSinceReferenceDate(value.date()));
      return;
    case Value::Kind::Data: {
      const Bytes& data = value.data();
      putMarker(out, kData, data.size());
      out.insert(out.end(), data.begin(), data.end());
      return;
    }
    default:  // strings and containers are not scalars; none values are never added
      return;
  }
}

}  // namespace vtc::plist
