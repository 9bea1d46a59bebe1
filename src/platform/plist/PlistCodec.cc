#include "platform/plist/PlistCodec.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <cstring>
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

namespace {

// Reads one node at depth; false when it nests too deep or goes over budget.
bool read(::plist_t node, unsigned depth, ReadBudget* budget, Value& out) {
  if (budget && !budget->spend(ReadBudget::kValueCost)) return false;
  if (!node) return true;
  switch (plist_get_node_type(node)) {
    case PLIST_BOOLEAN: {
      uint8_t b = 0;
      plist_get_bool_val(node, &b);
      out = Value(b != 0);
      return true;
    }
    case PLIST_UINT: {
      uint64_t u = 0;
      plist_get_uint_val(node, &u);
      out = Value(static_cast<long long>(u));
      return true;
    }
    case PLIST_REAL: {
      double d = 0;
      plist_get_real_val(node, &d);
      out = Value(d);
      return true;
    }
    case PLIST_STRING:
    case PLIST_KEY: {
      uint64_t len = 0;
      const char* s = plist_get_string_ptr(node, &len);
      if (budget && !budget->spend(len)) return false;
      out = Value(std::string(s ? s : "", static_cast<size_t>(len)));
      return true;
    }
    case PLIST_DATE: {
      int32_t sec = 0, usec = 0;
      plist_get_date_val(node, &sec, &usec);
      auto us =
          std::chrono::microseconds((int64_t{sec} + binary::kEpochOffsetSeconds) * 1000000 + usec);
      out = Value(Date(std::chrono::duration_cast<Date::duration>(us)));
      return true;
    }
    case PLIST_DATA: {
      uint64_t len = 0;
      const char* p = plist_get_data_ptr(node, &len);
      if (budget && !budget->spend(len)) return false;
      const auto* bytes = reinterpret_cast<const uint8_t*>(p);
      out = Value(Bytes(bytes, bytes + len));
      return true;
    }
    case PLIST_ARRAY: {
      const uint32_t n = plist_array_get_size(node);
      if (n > 0 && depth >= binary::kMaxDepth) return false;
      Array& array = out.mutableArray();
      array.reserve(n);
      for (uint32_t i = 0; i < n; ++i)
        if (!read(plist_array_get_item(node, i), depth + 1, budget, array.emplace_back()))
          return false;
      return true;
    }
    case PLIST_DICT: {
      if (plist_dict_get_size(node) > 0 && depth >= binary::kMaxDepth) return false;
      Dictionary& dict = out.mutableDictionary();
      plist_dict_iter it = nullptr;
      plist_dict_new_iter(node, &it);
      bool ok = true;
      for (;;) {
        char* key = nullptr;
        ::plist_t item = nullptr;
        plist_dict_next_item(node, it, &key, &item);
        if (!key) break;
        Value value;
        ok = (!budget || budget->spend(std::strlen(key))) && read(item, depth + 1, budget, value);
        if (ok) dict.set(key, std::move(value));
        std::free(key);
        if (!ok) break;
      }
      std::free(it);
      return ok;
    }
    default:
      return true;
  }
}

// Whether the elements of an XML document nest no deeper than limit. Tags
// are counted without parsing: comments, processing instructions and CDATA
// do not nest, a self-closed element neither. A document type with an
// internal subset (entity declarations) is refused: property lists have
// none.
bool nestsWithin(ByteView xml, unsigned limit) {
  const auto* p = reinterpret_cast<const char*>(xml.data());
  const std::string_view text(p, xml.size());
  unsigned depth = 0;
  size_t i = 0;
  auto skipPast = [&](std::string_view end) {
    const size_t at = text.find(end, i);
    i = at == std::string_view::npos ? text.size() : at + end.size();
  };
  while ((i = text.find('<', i)) != std::string_view::npos) {
    const std::string_view rest = text.substr(i);
    if (rest.starts_with("<?")) {
      skipPast("?>");
    } else if (rest.starts_with("<!--")) {
      skipPast("-->");
    } else if (rest.starts_with("<![CDATA[")) {
      skipPast("]]>");
    } else if (rest.starts_with("<!")) {
      const size_t close = rest.find('>');
      if (rest.substr(0, close).find('[') != std::string_view::npos) return false;
      skipPast(">");
    } else {
      // To the end of the tag, past quoted attribute values.
      const bool closing = rest.starts_with("</");
      char quote = 0;
      size_t j = i + 1;
      for (; j < text.size(); ++j) {
        if (quote) {
          if (text[j] == quote) quote = 0;
        } else if (text[j] == '"' || text[j] == '\'') {
          quote = text[j];
        } else if (text[j] == '>') {
          break;
        }
      }
      const bool selfClosed = j < text.size() && text[j - 1] == '/';
      if (closing) {
        if (depth > 0) --depth;
      } else if (!selfClosed && ++depth > limit) {
        return false;
      }
      i = j;
    }
  }
  return true;
}

}  // namespace

std::optional<Value> fromPlist(::plist_t node, ReadBudget* budget) {
  Value out;
  if (!read(node, 0, budget, out)) return std::nullopt;
  return out;
}

std::optional<Value> parse(ByteView bytes, ReadBudget* budget) {
  if (bytes.empty() || bytes.size() > UINT32_MAX) return std::nullopt;
  if (bytes.size() >= binary::kMagicSize &&
      std::equal(binary::kMagic, binary::kMagic + binary::kMagicSize, bytes.begin()))
    return parseBinary(bytes, budget);
  // The value's depth plus the <plist> element and the top value's own.
  if (!nestsWithin(bytes, binary::kMaxDepth + 2)) return std::nullopt;
  ::plist_t root = nullptr;
  plist_from_memory(reinterpret_cast<const char*>(bytes.data()),
                    static_cast<uint32_t>(bytes.size()), &root);
  if (!root) return std::nullopt;
  PlistPtr owner(root);
  return fromPlist(root, budget);
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
