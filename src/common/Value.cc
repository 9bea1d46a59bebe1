#include "VantorSyncManager/Value.h"

#include <algorithm>
#include <cctype>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <ctime>
#include <unordered_map>

#include "common/Format.h"

namespace vtc {

namespace {

const std::string kEmptyString;
const Bytes kEmptyBytes;
const Array kEmptyArray;
const Dictionary kEmptyDictionary;
const Value kNoneValue;

// Small dictionaries (most of them: property changes, records) are searched
// in place; an index is kept only past kIndexedSize entries.
constexpr size_t kIndexedSize = 16;

// Leading integer of a string, as a property-list reader reads "42abc".
int64_t leadingInteger(const std::string& s) {
  return std::strtoll(s.c_str(), nullptr, 10);
}

bool needsQuotes(const std::string& s) {
  if (s.empty()) return true;
  for (unsigned char c : s) {
    if (!(std::isalnum(c) || c == '_' || c == '.' || c == '/' || c == '$' || c == ':' || c == '-'))
      return true;
  }
  return false;
}

std::string quoted(const std::string& s) {
  if (!needsQuotes(s)) return s;
  std::string out = "\"";
  for (char c : s) {
    if (c == '"' || c == '\\') out += '\\';
    if (c == '\n') {
      out += "\\n";
      continue;
    }
    out += c;
  }
  out += '"';
  return out;
}

std::string indent(int level) {
  return std::string(static_cast<size_t>(level) * 4, ' ');
}

std::string describe(const Value& v, int level);

std::string describeDictionary(const Dictionary& d, int level) {
  std::string out = "{\n";
  for (const auto& [key, value] : d) {
    out += indent(level + 1) + quoted(key) + " = " + describe(value, level + 1) + ";\n";
  }
  out += indent(level) + "}";
  return out;
}

std::string describe(const Value& v, int level) {
  char buf[64];
  switch (v.kind()) {
    case Value::Kind::None:
      return "(null)";
    case Value::Kind::String:
      return quoted(v.string());
    case Value::Kind::Integer:
      return std::to_string(v.integer());
    case Value::Kind::Real:
      return shortestText(v.real());
    case Value::Kind::Boolean:
      return v.boolean() ? "1" : "0";
    case Value::Kind::Date: {
      std::time_t t = std::chrono::system_clock::to_time_t(v.date());
      std::tm tm{};
      gmtime_r(&t, &tm);
      std::strftime(buf, sizeof buf, "%Y-%m-%d %H:%M:%S +0000", &tm);
      return buf;
    }
    case Value::Kind::Data: {
      std::string out = "<";
      const Bytes& b = v.data();
      for (size_t i = 0; i < b.size(); ++i) {
        if (i > 0 && i % 4 == 0) out += ' ';
        std::snprintf(buf, sizeof buf, "%02x", b[i]);
        out += buf;
      }
      return out + ">";
    }
    case Value::Kind::Array: {
      const Array& a = v.array();
      if (a.empty()) return "(\n" + indent(level) + ")";
      std::string out = "(\n";
      for (size_t i = 0; i < a.size(); ++i) {
        out += indent(level + 1) + describe(a[i], level + 1);
        out += (i + 1 < a.size()) ? ",\n" : "\n";
      }
      return out + indent(level) + ")";
    }
    case Value::Kind::Dictionary:
      return describeDictionary(v.dictionary(), level);
  }
  return {};
}

}  // namespace

Value::Value(const char* s) : Value(s ? std::string_view(s) : std::string_view()) {
  if (!s) v_ = std::monostate{};
}
Value::Value(std::string s) {
  if (s.size() >= kSharedSize)
    v_ = std::make_shared<const std::string>(std::move(s));
  else
    v_ = std::move(s);
}
Value::Value(std::string_view s) : Value(std::string(s)) {}
Value::Value(Bytes b) {
  if (b.size() >= kSharedSize)
    v_ = std::make_shared<const Bytes>(std::move(b));
  else
    v_ = std::move(b);
}
Value::Value(Array a) : v_(std::move(a)) {}
Value::Value(Dictionary d) : v_(std::move(d)) {}

Value::Value(const Value& other) = default;
Value::Value(Value&& other) noexcept = default;
Value::~Value() = default;
Value& Value::operator=(const Value& other) = default;
Value& Value::operator=(Value&& other) noexcept = default;

Value::Kind Value::kind() const {
  switch (v_.index()) {
    case 0:
      return Kind::None;
    case 1:
      return Kind::String;
    case 2:
      return Kind::Integer;
    case 3:
      return Kind::Real;
    case 4:
      return Kind::Boolean;
    case 5:
      return Kind::Date;
    case 6:
      return Kind::Data;
    case 7:
      return Kind::Array;
    case 8:
      return Kind::Dictionary;
    case 9:
      return Kind::String;
    default:
      return Kind::Data;
  }
}

const std::string* Value::stringIfAny() const {
  if (auto* s = std::get_if<std::string>(&v_)) return s;
  if (auto* shared = std::get_if<std::shared_ptr<const std::string>>(&v_)) return shared->get();
  return nullptr;
}

const std::string& Value::string() const {
  const std::string* s = stringIfAny();
  return s ? *s : kEmptyString;
}

int64_t Value::integer() const {
  if (auto* i = std::get_if<int64_t>(&v_)) return *i;
  if (auto* d = std::get_if<double>(&v_)) return static_cast<int64_t>(*d);
  if (auto* b = std::get_if<bool>(&v_)) return *b ? 1 : 0;
  if (auto* s = stringIfAny()) return leadingInteger(*s);
  return 0;
}

double Value::real() const {
  if (auto* d = std::get_if<double>(&v_)) return *d;
  if (auto* i = std::get_if<int64_t>(&v_)) return static_cast<double>(*i);
  if (auto* b = std::get_if<bool>(&v_)) return *b ? 1.0 : 0.0;
  if (auto* s = stringIfAny()) return std::strtod(s->c_str(), nullptr);
  return 0.0;
}

bool Value::boolean() const {
  if (auto* b = std::get_if<bool>(&v_)) return *b;
  if (auto* i = std::get_if<int64_t>(&v_)) return *i != 0;
  if (auto* d = std::get_if<double>(&v_)) return *d != 0.0;
  if (auto* s = stringIfAny()) {
    // "YES", "true" or a non-zero leading number, skipping leading blanks.
    size_t i = s->find_first_not_of(" \t\n");
    if (i == std::string::npos) return false;
    char c = (*s)[i];
    if (c == 'Y' || c == 'y' || c == 'T' || c == 't') return true;
    if (c == '+' || c == '-') ++i;
    for (; i < s->size() && std::isdigit(static_cast<unsigned char>((*s)[i])); ++i)
      if ((*s)[i] != '0') return true;
    return false;
  }
  return false;
}

Date Value::date() const {
  auto* d = std::get_if<Date>(&v_);
  return d ? *d : Date{};
}

const Bytes& Value::data() const {
  if (auto* b = std::get_if<Bytes>(&v_)) return *b;
  if (auto* shared = std::get_if<std::shared_ptr<const Bytes>>(&v_)) return **shared;
  return kEmptyBytes;
}

const Array& Value::array() const {
  auto* a = std::get_if<Array>(&v_);
  return a ? *a : kEmptyArray;
}

const Dictionary& Value::dictionary() const {
  auto* d = std::get_if<Dictionary>(&v_);
  return d ? *d : kEmptyDictionary;
}

Array& Value::mutableArray() {
  if (!std::holds_alternative<Array>(v_)) v_ = Array();
  return std::get<Array>(v_);
}

Dictionary& Value::mutableDictionary() {
  if (!std::holds_alternative<Dictionary>(v_)) v_ = Dictionary();
  return std::get<Dictionary>(v_);
}

std::string Value::description() const {
  return describe(*this, 0);
}

bool operator==(const Value& a, const Value& b) {
  if (a.kind() != b.kind()) return false;
  switch (a.kind()) {
    case Value::Kind::None:
      return true;
    case Value::Kind::String:
      return &a.string() == &b.string() || a.string() == b.string();
    case Value::Kind::Integer:
      return a.integer() == b.integer();
    case Value::Kind::Real:
      return a.real() == b.real();
    case Value::Kind::Boolean:
      return a.boolean() == b.boolean();
    case Value::Kind::Date:
      return a.date() == b.date();
    case Value::Kind::Data:
      return &a.data() == &b.data() || a.data() == b.data();
    case Value::Kind::Array:
      return a.array() == b.array();
    case Value::Kind::Dictionary:
      return a.dictionary() == b.dictionary();
  }
  return false;
}

struct Dictionary::Index {
  struct Hash {
    using is_transparent = void;
    size_t operator()(std::string_view s) const { return std::hash<std::string_view>{}(s); }
  };
  std::unordered_map<std::string, size_t, Hash, std::equal_to<>> positions;
};

Dictionary::Dictionary() = default;
Dictionary::Dictionary(std::initializer_list<Entry> entries) {
  for (const auto& [k, v] : entries) set(k, v);
}
Dictionary::Dictionary(const Dictionary& other) : entries_(other.entries_) {
  reindex();
}
Dictionary::Dictionary(Dictionary&& other) noexcept = default;
Dictionary& Dictionary::operator=(const Dictionary& other) {
  if (this != &other) {
    entries_ = other.entries_;
    reindex();
  }
  return *this;
}
Dictionary& Dictionary::operator=(Dictionary&& other) noexcept = default;
Dictionary::~Dictionary() = default;

void Dictionary::reserve(size_t entries) {
  entries_.reserve(entries);
}

const Value* Dictionary::find(std::string_view key) const {
  if (entries_.size() <= kIndexedSize) {
    for (const auto& e : entries_)
      if (e.first == key) return &e.second;
    return nullptr;
  }
  auto it = index_->positions.find(key);
  return it == index_->positions.end() ? nullptr : &entries_[it->second].second;
}

Value* Dictionary::find(std::string_view key) {
  return const_cast<Value*>(static_cast<const Dictionary*>(this)->find(key));
}

const Value& Dictionary::get(std::string_view key) const {
  const Value* v = find(key);
  return v ? *v : kNoneValue;
}

void Dictionary::set(std::string_view key, Value value) {
  slot(key) = std::move(value);
}

Value& Dictionary::slot(std::string_view key) {
  if (Value* existing = find(key)) return *existing;
  entries_.emplace_back(std::string(key), Value());
  if (entries_.size() > kIndexedSize) {
    if (!index_)
      reindex();
    else
      index_->positions.emplace(entries_.back().first, entries_.size() - 1);
  }
  return entries_.back().second;
}

bool Dictionary::erase(std::string_view key) {
  auto at = std::find_if(entries_.begin(), entries_.end(),
                         [&](const Entry& e) { return e.first == key; });
  if (at == entries_.end()) return false;
  entries_.erase(at);
  reindex();
  return true;
}

void Dictionary::merge(const Dictionary& other) {
  for (const auto& [k, v] : other) set(k, v);
}

void Dictionary::clear() {
  entries_.clear();
  index_.reset();
}

std::vector<std::string> Dictionary::keys() const {
  std::vector<std::string> out;
  out.reserve(entries_.size());
  for (const auto& e : entries_) out.push_back(e.first);
  return out;
}

std::string Dictionary::description() const {
  return describeDictionary(*this, 0);
}

void Dictionary::reindex() {
  index_.reset();
  if (entries_.size() <= kIndexedSize) return;
  index_ = std::make_unique<Index>();
  for (size_t i = 0; i < entries_.size(); ++i) index_->positions.emplace(entries_[i].first, i);
}

bool operator==(const Dictionary& a, const Dictionary& b) {
  if (a.size() != b.size()) return false;
  for (const auto& [k, v] : a) {
    const Value* other = b.find(k);
    if (!other || !(*other == v)) return false;
  }
  return true;
}

}  // namespace vtc
