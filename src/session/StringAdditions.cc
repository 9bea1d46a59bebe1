#include "VantorSyncManager/StringAdditions.h"

#include "platform/dav/XmlTree.h"

std::string stringByAppendingTesselPathComponent(std::string_view path,
                                                 std::string_view component) {
  std::string out(path);
  out += '/';
  out += component;
  return out;
}

std::string stringByXMLQuoting(std::string_view text) {
  return vtc::xmlEscape(text);
}
