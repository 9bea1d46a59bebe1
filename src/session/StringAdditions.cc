#include "VantorSyncManager/StringAdditions.h"

std::string stringByAppendingTesselPathComponent(std::string_view path,
                                                 std::string_view component) {
  std::string out(path);
  out += '/';
  out += component;
  return out;
}

std::string stringByXMLQuoting(std::string_view text) {
  std::string out;
  out.reserve(text.size() + 16);
  for (char c : text) {
    switch (c) {
      case '&':
        out += "&amp;";
        break;
      case '<':
        out += "&lt;";
        break;
      case '>':
        out += "&gt;";
        break;
      case '"':
        out += "&quot;";
        break;
      default:
        out += c;
    }
  }
  return out;
}
