// The one formatter: printf conversions plus "%@", which takes any value that
// has a text form (strings, numbers, vtc::Value, vtc::Dictionary, sets and
// vectors of strings, and every type with a description() member).
#pragma once

#include <concepts>
#include <cstdint>
#include <optional>
#include <set>
#include <span>
#include <string>
#include <string_view>
#include <type_traits>
#include <variant>
#include <vector>

#include "VantorSyncManager/Value.h"

namespace vtc {

// The shortest text that reads back as the same number ("0.1", "2.5", "1e+20").
std::string shortestText(double v);

// Text forms used by "%@".
inline std::string textOf(const std::string& s) {
  return s;
}
inline std::string textOf(std::string_view s) {
  return std::string(s);
}
inline std::string textOf(const char* s) {
  return s ? s : "(null)";
}
inline std::string textOf(const Value& v) {
  return v.isString() ? v.string() : v.description();
}
inline std::string textOf(const Dictionary& d) {
  return d.description();
}
std::string textOf(const std::vector<std::string>& list);
std::string textOf(const std::set<std::string>& set);
template <typename T>
requires std::is_arithmetic_v<T> std::string textOf(T v) {
  if constexpr (std::is_same_v<T, bool>)
    return v ? "1" : "0";
  else if constexpr (std::is_floating_point_v<T>)
    return shortestText(static_cast<double>(v));
  else
    return std::to_string(v);
}
template <typename T>
requires requires(const T& t) {
  { t.description() } -> std::convertible_to<std::string>;
}
std::string textOf(const T& t) {
  return t.description();
}
template <typename T>
std::string textOf(const std::optional<T>& o) {
  return o ? textOf(*o) : std::string("(null)");
}

// One argument of a format call: a number, a pointer, or a text.
struct FormatArg {
  struct Text {
    std::string text;
    bool wasNull = false;  // a null C string given for %s
  };
  std::variant<int64_t, uint64_t, double, const void*, Text> v;
};

template <typename T>
FormatArg makeFormatArg(const T& a) {
  if constexpr (std::is_array_v<T>) {
    return {FormatArg::Text{std::string(a), false}};
  } else if constexpr (std::is_same_v<T, bool>) {
    return {int64_t{a ? 1 : 0}};
  } else if constexpr (std::is_integral_v<T> && std::is_signed_v<T>) {
    return {int64_t{a}};
  } else if constexpr (std::is_integral_v<T>) {
    return {uint64_t{a}};
  } else if constexpr (std::is_floating_point_v<T>) {
    return {double{a}};
  } else if constexpr (std::is_same_v<std::decay_t<T>, const char*> ||
                       std::is_same_v<std::decay_t<T>, char*>) {
    return {FormatArg::Text{a ? a : "(null)", a == nullptr}};
  } else if constexpr (std::is_pointer_v<T>) {
    return {static_cast<const void*>(a)};
  } else {
    return {FormatArg::Text{textOf(a), false}};
  }
}

std::string formatArgs(std::string_view format, std::span<const FormatArg> args);

// The text whole when it is at most `most` bytes; otherwise its start, cut at
// a character boundary, and how many bytes were left out: for quoting input
// from outside in log lines and reasons.
std::string clipped(std::string_view text, size_t most);

template <typename... A>
std::string format(std::string_view fmt, const A&... args) {
  const FormatArg list[] = {makeFormatArg(args)..., FormatArg{int64_t{0}}};
  return formatArgs(fmt, std::span<const FormatArg>(list, sizeof...(A)));
}

}  // namespace vtc
