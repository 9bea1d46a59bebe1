#include "platform/plist/PlistCodec.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <iterator>

#include "platform/fs/AtomicWrite.h"
#include "platform/plist/BinaryPlistFormat.h"
#include "platform/plist/BinaryPlistReader.h"
#include "platform/plist/BinaryPlistWriter.h"

namespace vtc::plist {

namespace {

struct PlistFree {
  void operator()(::plist_t p) const { plist_free(p); }
};
using PlistPtr = std::unique_ptr<void, PlistFree>;

}  // namespace

::plist_t toPlist(const Value& value) {
  switch (value.kind()) {
    case Value::Kind::None:
      return nullptr;
    case Value::Kind::String:
      return plist_new_string(value.string().c_str());
    case Value::Kind::Integer:
      return plist_new_uint(static_cast<uint64_t>(value.integer()));
    case Value::Kind::Real:
      return plist_new_real(value.real());
    case Value::Kind::Boolean:
      return plist_new_bool(value.boolean() ? 1 : 0);
    case Value::Kind::Date: {
      auto us =
          std::chrono::duration_cast<std::chrono::microseconds>(value.date().time_since_epoch())
              .count();
      int64_t sec = us / 1000000;
      int64_t usec = us % 1000000;
      if (usec < 0) {
        usec += 1000000;
        sec -= 1;
      }
      return plist_new_date(static_cast<int32_t>(sec - binary::kEpochOffsetSeconds),
                            static_cast<int32_t>(usec));
    }
    case Value::Kind::Data: {
      const Bytes& b = value.data();
      return plist_new_data(reinterpret_cast<const char*>(b.data()), b.size());
    }
    case Value::Kind::Array: {
      ::plist_t array = plist_new_array();
      for (const Value& item : value.array()) {
        if (::plist_t node = toPlist(item)) plist_array_append_item(array, node);
      }
      return array;
    }
    case Value::Kind::Dictionary: {
      ::plist_t dict = plist_new_dict();
      for (const auto& [key, item] : value.dictionary()) {
        if (::plist_t node = toPlist(item)) plist_dict_set_item(dict, key.c_str(), node);
      }
      return dict;
    }
  }
  return nullptr;
}

Value fromPlist(::plist_t node) {
  if (!node) return {};
  switch (plist_get_node_type(node)) {
    case PLIST_BOOLEAN: {
      uint8_t b = 0;
      plist_get_bool_val(node, &b);
      return Value(b != 0);
    }
    case PLIST_UINT: {
      uint64_t u = 0;
      plist_get_uint_val(node, &u);
      return Value(static_cast<long long>(u));
    }
    case PLIST_REAL: {
      double d = 0;
      plist_get_real_val(node, &d);
      return Value(d);
    }
    case PLIST_STRING:
    case PLIST_KEY: {
      uint64_t len = 0;
      const char* s = plist_get_string_ptr(node, &len);
      return Value(std::string(s ? s : "", static_cast<size_t>(len)));
    }
    case PLIST_DATE: {
      int32_t sec = 0, usec = 0;
      plist_get_date_val(node, &sec, &usec);
      auto us =
          std::chrono::microseconds((int64_t{sec} + binary::kEpochOffsetSeconds) * 1000000 + usec);
      return Value(Date(std::chrono::duration_cast<Date::duration>(us)));
    }
    case PLIST_DATA: {
      uint64_t len = 0;
      const char* p = plist_get_data_ptr(node, &len);
      const auto* bytes = reinterpret_cast<const uint8_t*>(p);
      return Value(Bytes(bytes, bytes + len));
    }
    case PLIST_ARRAY: {
      Array array;
      uint32_t n = plist_array_get_size(node);
      array.reserve(n);
      for (uint32_t i = 0; i < n; ++i) array.push_back(fromPlist(plist_array_get_item(node, i)));
      return Value(std::move(array));
    }
    case PLIST_DICT: {
      Dictionary dict;
      plist_dict_iter it = nullptr;
      plist_dict_new_iter(node, &it);
      for (;;) {
        char* key = nullptr;
        ::plist_t item = nullptr;
        plist_dict_next_item(node, it, &key, &item);
        if (!key) break;
        dict.set(key, fromPlist(item));
        std::free(key);
      }
      std::free(it);
      return Value(std::move(dict));
    }
    default:
      return {};
  }
}

std::optional<Value> parse(ByteView bytes) {
  if (bytes.empty() || bytes.size() > UINT32_MAX) return std::nullopt;
  if (bytes.size() >= binary::kMagicSize &&
      std::equal(binary::kMagic, binary::kMagic + binary::kMagicSize, bytes.begin()))
    return parseBinary(bytes);
  ::plist_t root = nullptr;
  plist_from_memory(reinterpret_cast<const char*>(bytes.data()),
                    static_cast<uint32_t>(bytes.size()), &root);
  if (!root) return std::nullopt;
  PlistPtr owner(root);
  return fromPlist(root);
}

std::string toXml(const Value& value) {
  PlistPtr root(toPlist(value));
  if (!root) return {};
  char* xml = nullptr;
  uint32_t len = 0;
  plist_to_xml(root.get(), &xml, &len);
  std::string out(xml ? xml : "", len);
  std::free(xml);
  return out;
}

Bytes toBinary(const Array& array) {
  Bytes out;
  BinaryPlistWriter().append(array, out);
  return out;
}

Bytes toBinary(const Value& value) {
  Bytes out;
  BinaryPlistWriter().append(value, out);
  return out;
}

std::optional<Value> readFile(const std::string& path) {
  // A folder opens as a stream but fails (with an exception) when read.
  struct stat st {};
  if (::stat(path.c_str(), &st) != 0 || !S_ISREG(st.st_mode)) return std::nullopt;
  std::ifstream in(path, std::ios::binary);
  if (!in) return std::nullopt;
  Bytes bytes((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
  return parse(bytes);
}

bool writeFileAtomically(const std::string& path, const Value& value, int mode) {
  std::string xml = toXml(value);
  return !xml.empty() && fs::writeFileAtomically(path, xml, mode);
}

}  // namespace vtc::plist
