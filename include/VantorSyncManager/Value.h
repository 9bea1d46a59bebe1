// vtc::Value: one property-list value (string, integer, real, boolean, date,
// data, array, dictionary, or none), and vtc::Dictionary, an insertion-ordered
// map from strings to values. Values are plain copyable data; a Value is not
// safe for concurrent mutation, concurrent reads are fine.
#pragma once

#include <chrono>
#include <cstdint>
#include <initializer_list>
#include <memory>
#include <span>
#include <string>
#include <string_view>
#include <unordered_map>
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
  Value(Bytes b) : v_(std::move(b)) {}
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
  Array& mutableArray();            // turns a none value into an empty array
  Dictionary& mutableDictionary();  // turns a none value into an empty dictionary

  // Old-style property-list text: strings quoted only when needed,
  // dictionaries as { key = value; }, arrays as ( a, b ), data as <0a1b>.
  std::string description() const;

  friend bool operator==(const Value& a, const Value& b);

 private:
  using Storage = std::variant<std::monostate, std::string, int64_t, double, bool, Date, Bytes,
                               std::unique_ptr<Array>, std::unique_ptr<Dictionary>>;
  Storage v_;
};

class VSM_EXPORT Dictionary {
 public:
  using Entry = std::pair<std::string, Value>;

  Dictionary() = default;
  Dictionary(std::initializer_list<Entry> entries);

  size_t size() const { return entries_.size(); }
  bool empty() const { return entries_.empty(); }
  bool contains(std::string_view key) const { return find(key) != nullptr; }

  // The value for key, or nullptr.
  const Value* find(std::string_view key) const;
  Value* find(std::string_view key);
  // The value for key, or a none value.
  const Value& get(std::string_view key) const;
  const Value& operator[](std::string_view key) const { return get(key); }

  // Adds or replaces; a replaced entry keeps its place.
  void set(std::string key, Value value);
  bool erase(std::string_view key);
  void merge(const Dictionary& other);  // other's entries on top
  void clear();

  std::vector<std::string> keys() const;
  auto begin() const { return entries_.begin(); }
  auto end() const { return entries_.end(); }

  std::string description() const;

  // Equal when both hold the same keys with equal values, in any order.
  friend bool operator==(const Dictionary& a, const Dictionary& b);

 private:
  struct KeyHash {
    using is_transparent = void;
    size_t operator()(std::string_view s) const { return std::hash<std::string_view>{}(s); }
  };
  void reindex();
  std::vector<Entry> entries_;
  std::unordered_map<std::string, size_t, KeyHash, std::equal_to<>> index_;
};

}  // namespace vtc
