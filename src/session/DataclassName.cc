#include "session/DataclassName.h"

#include <cstdio>
#include <stdexcept>

namespace vtc {

namespace {

bool isPlain(char c) {
  return (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') || (c >= '0' && c <= '9') || c == '.' ||
         c == '_' || c == '-';
}

std::string shown(char c) {
  const auto byte = static_cast<unsigned char>(c);
  if (byte < 0x20 || byte >= 0x7F) {
    char text[8];
    std::snprintf(text, sizeof text, "\\x%02X", byte);
    return std::string("the byte ") + text;
  }
  return std::string("the character '") + c + "'";
}

}  // namespace

std::string dataclassNameProblem(std::string_view name) {
  if (name.empty()) return "it is empty";
  if (name.size() > kMaxDataclassNameLength)
    return "it is longer than " + std::to_string(kMaxDataclassNameLength) + " characters";
  if (name.front() == '.') return "it starts with '.'";
  if (name.find("..") != std::string_view::npos) return "it contains \"..\"";
  for (char c : name)
    if (!isPlain(c)) return "it contains " + shown(c);
  return {};
}

void requirePlainDataclassName(std::string_view name) {
  const std::string problem = dataclassNameProblem(name);
  if (!problem.empty()) throw std::invalid_argument("Not a dataclass name, for " + problem + ".");
}

}  // namespace vtc
