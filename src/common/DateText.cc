#include "common/DateText.h"

#include <cctype>
#include <chrono>

namespace vtc::dates {

namespace {

// Reads exactly `width` digits at the front of text.
std::optional<int> digits(std::string_view& text, size_t width) {
  if (text.size() < width) return std::nullopt;
  int value = 0;
  for (size_t i = 0; i < width; ++i) {
    if (!std::isdigit(static_cast<unsigned char>(text[i]))) return std::nullopt;
    value = value * 10 + (text[i] - '0');
  }
  text.remove_prefix(width);
  return value;
}

}  // namespace

std::optional<Date> parse(std::string_view text, std::string_view pattern) {
  int year = 1970, month = 1, day = 1, hour = 0, minute = 0, second = 0, millis = 0;
  int offsetMinutes = 0;
  while (!pattern.empty()) {
    const char letter = pattern.front();
    size_t run = 1;
    while (run < pattern.size() && pattern[run] == letter) ++run;
    std::string_view field = pattern.substr(0, run);
    pattern.remove_prefix(run);

    int* target = field == "yyyy"  ? &year
                  : field == "MM"  ? &month
                  : field == "dd"  ? &day
                  : field == "HH"  ? &hour
                  : field == "mm"  ? &minute
                  : field == "ss"  ? &second
                  : field == "SSS" ? &millis
                                   : nullptr;
    if (target) {
      std::optional<int> value = digits(text, run);
      if (!value) return std::nullopt;
      *target = *value;
    } else if (field == "ZZZ") {
      if (text.empty() || (text.front() != '+' && text.front() != '-')) return std::nullopt;
      const int sign = text.front() == '-' ? -1 : 1;
      text.remove_prefix(1);
      std::optional<int> hours = digits(text, 2);
      std::optional<int> minutes = digits(text, 2);
      if (!hours || !minutes || *hours > 23 || *minutes > 59) return std::nullopt;
      offsetMinutes = sign * (*hours * 60 + *minutes);
    } else {
      // Any other characters are literal text.
      if (!text.starts_with(field)) return std::nullopt;
      text.remove_prefix(run);
    }
  }
  if (!text.empty()) return std::nullopt;

  using namespace std::chrono;
  const year_month_day date{std::chrono::year(year), std::chrono::month(month),
                            std::chrono::day(day)};
  if (!date.ok() || hour > 23 || minute > 59 || second > 59) return std::nullopt;
  return time_point_cast<Date::duration>(sys_days(date) + hours(hour) + minutes(minute) +
                                         seconds(second) + milliseconds(millis) -
                                         minutes(offsetMinutes));
}

}  // namespace vtc::dates
