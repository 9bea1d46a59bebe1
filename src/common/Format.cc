#include "common/Format.h"

#include <algorithm>
#include <cctype>
#include <charconv>
#include <cstdio>
#include <cstring>

namespace vtc {

std::string shortestText(double v) {
  char buf[64];
  auto [end, ec] = std::to_chars(buf, buf + sizeof buf, v);
  return ec == std::errc() ? std::string(buf, end) : std::to_string(v);
}

std::string textOf(const std::vector<std::string>& list) {
  std::string out = "(";
  for (size_t i = 0; i < list.size(); ++i) out += (i ? ", " : "") + list[i];
  return out + ")";
}

std::string textOf(const std::set<std::string>& set) {
  return textOf(std::vector<std::string>(set.begin(), set.end()));
}

namespace {

std::string printfOne(const std::string& directive, const FormatArg& arg, char conv) {
  char buf[512];
  int n = 0;
  std::string full = directive;
  switch (conv) {
    case 'd':
    case 'i':
    case 'c': {
      int64_t v = 0;
      if (auto* s = std::get_if<int64_t>(&arg.v))
        v = *s;
      else if (auto* u = std::get_if<uint64_t>(&arg.v))
        v = static_cast<int64_t>(*u);
      else if (auto* d = std::get_if<double>(&arg.v))
        v = static_cast<int64_t>(*d);
      else if (auto* t = std::get_if<FormatArg::Text>(&arg.v))
        return t->text;
      if (conv == 'c') {
        full += 'c';
        n = std::snprintf(buf, sizeof buf, full.c_str(), static_cast<int>(v));
      } else {
        full += "lld";
        n = std::snprintf(buf, sizeof buf, full.c_str(), static_cast<long long>(v));
      }
      break;
    }
    case 'u':
    case 'x':
    case 'X':
    case 'o': {
      uint64_t v = 0;
      if (auto* u = std::get_if<uint64_t>(&arg.v))
        v = *u;
      else if (auto* s = std::get_if<int64_t>(&arg.v))
        v = static_cast<uint64_t>(*s);
      else if (auto* d = std::get_if<double>(&arg.v))
        v = static_cast<uint64_t>(*d);
      else if (auto* t = std::get_if<FormatArg::Text>(&arg.v))
        return t->text;
      full += "ll";
      full += conv;
      n = std::snprintf(buf, sizeof buf, full.c_str(), static_cast<unsigned long long>(v));
      break;
    }
    case 'f':
    case 'F':
    case 'e':
    case 'E':
    case 'g':
    case 'G':
    case 'a':
    case 'A': {
      double v = 0;
      if (auto* d = std::get_if<double>(&arg.v))
        v = *d;
      else if (auto* s = std::get_if<int64_t>(&arg.v))
        v = static_cast<double>(*s);
      else if (auto* u = std::get_if<uint64_t>(&arg.v))
        v = static_cast<double>(*u);
      else if (auto* t = std::get_if<FormatArg::Text>(&arg.v))
        return t->text;
      full += conv;
      n = std::snprintf(buf, sizeof buf, full.c_str(), v);
      break;
    }
    case 'p': {
      const void* p = nullptr;
      if (auto* q = std::get_if<const void*>(&arg.v)) p = *q;
      full += 'p';
      n = std::snprintf(buf, sizeof buf, full.c_str(), p);
      break;
    }
    case 's':
    default: {
      std::string text;
      if (auto* t = std::get_if<FormatArg::Text>(&arg.v))
        text = t->text;
      else if (auto* s = std::get_if<int64_t>(&arg.v))
        text = std::to_string(*s);
      else if (auto* u = std::get_if<uint64_t>(&arg.v))
        text = std::to_string(*u);
      else if (auto* d = std::get_if<double>(&arg.v))
        text = shortestText(*d);
      if (directive == "%") return text;
      full += 's';
      int len = std::snprintf(nullptr, 0, full.c_str(), text.c_str());
      std::string out(static_cast<size_t>(len > 0 ? len : 0), '\0');
      std::snprintf(out.data(), out.size() + 1, full.c_str(), text.c_str());
      return out;
    }
  }
  if (n < 0) return {};
  return std::string(buf, std::min<size_t>(static_cast<size_t>(n), sizeof buf - 1));
}

}  // namespace

std::string formatArgs(std::string_view fmt, std::span<const FormatArg> args) {
  std::string out;
  out.reserve(fmt.size() + 32);
  size_t next = 0;
  const FormatArg missing{FormatArg::Text{"(null)", true}};
  auto take = [&]() -> const FormatArg& { return next < args.size() ? args[next++] : missing; };

  for (size_t i = 0; i < fmt.size(); ++i) {
    char c = fmt[i];
    if (c != '%') {
      out += c;
      continue;
    }
    if (i + 1 >= fmt.size()) {
      out += '%';
      break;
    }
    if (fmt[i + 1] == '%') {
      out += '%';
      ++i;
      continue;
    }
    if (fmt[i + 1] == '@') {
      const FormatArg& a = take();
      if (auto* t = std::get_if<FormatArg::Text>(&a.v))
        out += t->text;
      else
        out += printfOne("%", a, 's');
      ++i;
      continue;
    }
    // flags, width, precision
    std::string directive = "%";
    size_t j = i + 1;
    while (j < fmt.size() && std::strchr("-+ #0'", fmt[j])) directive += fmt[j++];
    while (j < fmt.size() && std::isdigit(static_cast<unsigned char>(fmt[j])))
      directive += fmt[j++];
    if (j < fmt.size() && fmt[j] == '.') {
      directive += fmt[j++];
      while (j < fmt.size() && std::isdigit(static_cast<unsigned char>(fmt[j])))
        directive += fmt[j++];
    }
    // length modifiers are dropped: the argument's own type decides
    while (j < fmt.size() && std::strchr("hlLqjzt", fmt[j])) ++j;
    if (j >= fmt.size()) {
      out.append(fmt.substr(i));
      break;
    }
    char conv = fmt[j];
    if (conv == '@') {
      const FormatArg& a = take();
      out += printfOne(directive, a, 's');
    } else {
      out += printfOne(directive, take(), conv);
    }
    i = j;
  }
  return out;
}

std::string clipped(std::string_view text, size_t most) {
  if (text.size() <= most) return std::string(text);
  size_t cut = most;
  // Back to the start of a UTF-8 sequence.
  while (cut > 0 && (static_cast<unsigned char>(text[cut]) & 0xC0) == 0x80) --cut;
  return std::string(text.substr(0, cut)) +
         format("... (%zu bytes more)", static_cast<size_t>(text.size() - cut));
}

}  // namespace vtc
