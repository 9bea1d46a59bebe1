#include "client/items/Meaning.h"

#include <iconv.h>

#include <algorithm>
#include <cerrno>
#include <optional>
#include <vector>

#include "client/items/ContentLines.h"
#include "common/Utf8.h"

namespace vtc::client {

namespace {

bool isUtf8(std::string_view s) {
  const auto* p = reinterpret_cast<const uint8_t*>(s.data());
  const auto* end = p + s.size();
  char32_t cp;
  while (p < end) {
    if (*p < 0x80) {
      ++p;
      continue;
    }
    size_t n = utf8::decode(p, end, cp);
    if (n == 0) return false;
    p += n;
  }
  return true;
}

int hexDigit(char c) {
  if (c >= '0' && c <= '9') return c - '0';
  if (c >= 'A' && c <= 'F') return c - 'A' + 10;
  if (c >= 'a' && c <= 'f') return c - 'a' + 10;
  return -1;
}

// Quoted-printable decoded; soft line breaks were joined when the line was read.
std::string decodeQuotedPrintable(std::string_view s) {
  std::string out;
  out.reserve(s.size());
  for (size_t i = 0; i < s.size(); ++i) {
    if (s[i] == '=' && i + 2 < s.size() && hexDigit(s[i + 1]) >= 0 && hexDigit(s[i + 2]) >= 0) {
      out.push_back(static_cast<char>(hexDigit(s[i + 1]) * 16 + hexDigit(s[i + 2])));
      i += 2;
    } else {
      out.push_back(s[i]);
    }
  }
  return out;
}

// Text in a named character set as UTF-8; none when iconv does not know the
// set or the bytes are not in it.
std::optional<std::string> toUtf8(std::string_view bytes, const std::string& charset) {
  iconv_t cd = ::iconv_open("UTF-8", charset.c_str());
  if (cd == reinterpret_cast<iconv_t>(-1)) return std::nullopt;
  std::string out(bytes.size() * 4 + 16, '\0');
  char* in = const_cast<char*>(bytes.data());
  size_t inLeft = bytes.size();
  char* to = out.data();
  size_t outLeft = out.size();
  const size_t result = ::iconv(cd, &in, &inLeft, &to, &outLeft);
  ::iconv_close(cd);
  if (result == static_cast<size_t>(-1)) return std::nullopt;
  out.resize(out.size() - outLeft);
  return out;
}

bool isDefaultType(const std::string& property, const std::string& type) {
  if (type == "TEXT") return true;
  static const char* const kDateTimes[] = {"DTSTART",   "DTEND",        "DUE",     "RECURRENCE-ID",
                                           "EXDATE",    "RDATE",        "DTSTAMP", "CREATED",
                                           "COMPLETED", "LAST-MODIFIED"};
  if (type == "DATE-TIME")
    for (const char* name : kDateTimes)
      if (property == name) return true;
  return type == "DURATION" && (property == "DURATION" || property == "TRIGGER");
}

std::string unquoted(std::string_view v) {
  if (v.size() >= 2 && v.front() == '"' && v.back() == '"') v = v.substr(1, v.size() - 2);
  return std::string(v);
}

}  // namespace

LineMeaning meaningOfLine(std::string_view text) {
  LineMeaning m;
  m.name = upperCase(lineName(text));
  std::string_view value = lineValue(text);
  bool quotedPrintable = false;
  std::string charset;
  std::vector<std::string> types;
  std::vector<std::pair<std::string, std::string>> parameters;
  for (const Parameter& p : splitParameters(lineParameters(text))) {
    std::string name = p.name.empty() ? "TYPE" : upperCase(p.name);
    if (name == "TYPE" && equalsIgnoringCase(p.value, "QUOTED-PRINTABLE")) name = "ENCODING";
    if (name == "ENCODING" && equalsIgnoringCase(p.value, "QUOTED-PRINTABLE")) {
      quotedPrintable = true;
      continue;
    }
    if (name == "CHARSET") {
      charset = upperCase(unquoted(p.value));
      continue;
    }
    if (name == "TYPE") {
      const std::string_view all = p.value;
      for (size_t start = 0;;) {
        const size_t comma = all.find(',', start);
        std::string_view one = all.substr(
            start, comma == std::string_view::npos ? std::string_view::npos : comma - start);
        if (!one.empty()) types.push_back(upperCase(unquoted(one)));
        if (comma == std::string_view::npos) break;
        start = comma + 1;
      }
      continue;
    }
    std::string v = unquoted(p.value);
    if (name == "ENCODING" || name == "VALUE") v = upperCase(v);
    // A value type that is the property's default says nothing.
    if (name == "VALUE" && isDefaultType(m.name, v)) continue;
    parameters.emplace_back(std::move(name), std::move(v));
  }
  std::string decoded = quotedPrintable ? decodeQuotedPrintable(value) : std::string(value);
  // A value in another character set is compared as UTF-8; one that does not
  // decode is compared as its bytes, with its charset kept as a difference.
  if (!charset.empty() && charset != "UTF-8" && charset != "US-ASCII") {
    if (auto converted = toUtf8(decoded, charset))
      decoded = std::move(*converted);
    else
      parameters.emplace_back("CHARSET", charset);
  }
  if (m.name == "BEGIN" || m.name == "END") {
    decoded = upperCase(decoded);
    while (!decoded.empty() && (decoded.back() == ' ' || decoded.back() == '\t'))
      decoded.pop_back();
  }
  if (!types.empty()) {
    std::sort(types.begin(), types.end());
    types.erase(std::unique(types.begin(), types.end()), types.end());
    std::string joined;
    for (const std::string& t : types) joined += (joined.empty() ? "" : ",") + t;
    parameters.emplace_back("TYPE", std::move(joined));
  }
  std::sort(parameters.begin(), parameters.end());
  for (const auto& [name, v] : parameters) m.parameters += ";" + name + "=" + v;
  m.value = std::move(decoded);
  return m;
}

std::string meaningOf(std::string_view raw) {
  std::string out;
  for (const ContentLine& line : readContentLines(raw)) {
    if (line.blank()) continue;
    std::string_view text = line.text();
    if (text.starts_with("\xEF\xBB\xBF")) text.remove_prefix(3);
    LineMeaning m = meaningOfLine(text);
    if (!out.empty()) out += '\n';
    if (m.name.empty()) {
      out += text;  // no content line: compared as written
      continue;
    }
    out += m.name;
    out += m.parameters;
    out += ':';
    out += m.value;
  }
  return out;
}

std::string_view rawOf(const Value& value) {
  if (value.isString()) return value.string();
  if (value.kind() == Value::Kind::Data)
    return std::string_view(reinterpret_cast<const char*>(value.data().data()),
                            value.data().size());
  return {};
}

Value fieldValue(std::string_view raw) {
  if (isUtf8(raw)) return Value(raw);
  return Value(Bytes(raw.begin(), raw.end()));
}

bool sameMeaning(const Value& a, const Value& b) {
  if (a.isNone() || b.isNone()) return a.isNone() && b.isNone();
  if (a == b) return true;
  return meaningOf(rawOf(a)) == meaningOf(rawOf(b));
}

}  // namespace vtc::client
