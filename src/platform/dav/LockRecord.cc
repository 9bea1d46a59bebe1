#include "platform/dav/LockRecord.h"

#include <ne_dates.h>

#include <charconv>

namespace vtc {

std::string LockRecord::text() const {
  return token + "\n" + std::to_string(static_cast<long long>(expires)) + "\n" + owner;
}

std::optional<LockRecord> LockRecord::parse(std::string_view text) {
  const size_t first = text.find('\n');
  if (first == std::string_view::npos || first == 0) return std::nullopt;
  const size_t second = text.find('\n', first + 1);
  if (second == std::string_view::npos) return std::nullopt;
  LockRecord r;
  r.token = std::string(text.substr(0, first));
  long long expires = 0;
  const char* begin = text.data() + first + 1;
  const char* end = text.data() + second;
  const auto [stop, error] = std::from_chars(begin, end, expires);
  if (error != std::errc() || stop != end) return std::nullopt;
  r.expires = static_cast<std::time_t>(expires);
  r.owner = std::string(text.substr(second + 1));
  return r;
}

std::optional<std::time_t> serverTime(const std::string& dateHeader) {
  if (dateHeader.empty()) return std::nullopt;
  const std::time_t t = ne_httpdate_parse(dateHeader.c_str());
  if (t == static_cast<std::time_t>(-1)) return std::nullopt;
  return t;
}

}  // namespace vtc
