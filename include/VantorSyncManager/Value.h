// vtc::Value: one property-list value (string, integer, real, boolean, date,
// data, array, dictionary, or none), and vtc::Dictionary, an insertion-ordered
// map from strings to values. Values are plain copyable data; a Value is not
// safe for concurrent mutation, concurrent reads are fine. Strings and data
// never change once made, so large ones are shared between copies: a photo
// held by a record, its change and its merge is in memory once.
#pragma once

#include <chrono>
#include <cstdint>
#include <initializer_list>
#include <memory>
#include <span>
#include <string>
#include <string_view>
#include <utility>
#include <variant>
#include <vector>

#include "VantorSyncManager/Export.h"

namespace vtc {

using Date = std::chrono::system_clock::time_point;
using Bytes = std::vector<uint8_t>;
using ByteView = std::span<const uint8_t>;

class Value;
class Dictionary;
using Array = std::vector<Value>;

class VSM_EXPORT Dictionary {
 public:
  using Entry = std::pair<std::string, Value>;

  // Special members live in the library: Value is incomplete here.
  Dictionary();
  Dictionary(std::initializer_list<Entry> entries);
  Dictionary(const Dictionary& other);
  Dictionary(Dictionary&& other) noexcept;
  Dictionary& operator=(const Dictionary& other);
  Dictionary& operator=(Dictionary&& other) noexcept;
  ~Dictionary();

  size_t size() const;
  bool empty() const;
  void reserve(size_t entries);
  bool contains(std::string_view key) const { return find(key) != nullptr; }

  // The value for key, or nullptr.
  const Value* find(std::string_view key) const;
  Value* find(std::string_view key);
  // The value for key, or a none value.
  const Value& get(std::string_view key) const;
  const Value& operator[](std::string_view key) const { return get(key); }

  // Adds or replaces; a replaced entry keeps its place.
  void set(std::string_view key, Value value);
  // The value under key, added at the end as a none value when missing.
  Value& slot(std::string_view key);
  bool erase(std::string_view key);
  void merge(const Dictionary& other);  // other's entries on top
  void clear();

  std::vector<std::string> keys() const;
  std::vector<Entry>::const_iterator begin() const;
  std::vector<Entry>::const_iterator end() const;

  std::string description() const;

  // Equal when both hold the same keys with equal values, in any order.
  friend bool operator==(const Dictionary& a, const Dictionary& b);

 private:
  struct Index;  // key to position, kept only for large dictionaries
  void reindex();
  std::vector<Entry> entries_;
  std::unique_ptr<Index> index_;
};

class VSM_EXPORT Value {
 public:
  enum class Kind { None, String, Integer, Real, Boolean, Date, Data, Array, Dictionary };

  Value() = default;
  Value(const char* s);  // NOLINT: implicit on purpose, values read like literals
  Value(std::string s);
  Value(std::string_view s);
  Value(int v) : v_(int64_t{v}) {}
  Value(long v) : v_(int64_t{v}) {}
  Value(long long v) : v_(int64_t{v}) {}
  Value(unsigned v) : v_(int64_t{v}) {}
  Value(unsigned long v) : v_(static_cast<int64_t>(v)) {}
  Value(double v) : v_(v) {}
  Value(bool v) : v_(v) {}
  Value(Date d) : v_(d) {}
  Value(Bytes b);
  Value(Array a);
  Value(Dictionary d);
  Value(const Value& other);
  Value(Value&& other) noexcept;
  Value& operator=(const Value& other);
  Value& operator=(Value&& other) noexcept;
  ~Value();

  Kind kind() const;
  bool isNone() const { return kind() == Kind::None; }
  bool isString() const { return kind() == Kind::String; }
  bool isNumber() const { return kind() == Kind::Integer || kind() == Kind::Real; }
  bool isDictionary() const { return kind() == Kind::Dictionary; }
  bool isArray() const { return kind() == Kind::Array; }
  explicit operator bool() const { return !isNone(); }

  // Typed access. A value of another kind yields an empty or zero result,
  // except that integer(), real() and boolean() also read numbers, booleans
  // and the leading number of a string, the way a property-list reader does.
  const std::string& string() const;
  int64_t integer() const;
  double real() const;
  bool boolean() const;
  Date date() const;
  const Bytes& data() const;
  const Array& array() const;
  const Dictionary& dictionary() const;
  // Each turns a value of another kind into an empty one of its own kind.
  Array& mutableArray();
  Dictionary& mutableDictionary();

  // Old-style property-list text: strings quoted only when needed,
  // dictionaries as { key = value; }, arrays as ( a, b ), data as <0a1b>.
  std::string description() const;

  friend bool operator==(const Value& a, const Value& b);

 private:
  // Containers are held in place: a decoded dictionary costs one allocation
  // (its entries), not two. Strings and data of kSharedSize bytes or more
  // are held shared (the last two kinds).
  using Storage =
      std::variant<std::monostate, std::string, int64_t, double, bool, Date, Bytes, Array,
                   Dictionary, std::shared_ptr<const std::string>, std::shared_ptr<const Bytes>>;
  static constexpr size_t kSharedSize = 1024;
  const std::string* stringIfAny() const;
  Storage v_;
};

inline size_t Dictionary::size() const {
  return entries_.size();
}
inline bool Dictionary::empty() const {
  return entries_.empty();
}
inline std::vector<Dictionary::Entry>::const_iterator Dictionary::begin() const {
  return entries_.begin();
}
inline std::vector<Dictionary::Entry>::const_iterator Dictionary::end() const {
  return entries_.end();
}

}  // namespace vtc
