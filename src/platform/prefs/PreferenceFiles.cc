#include "platform/prefs/PreferenceFiles.h"

#include <fstream>

#include "platform/fs/LocalPaths.h"
#include "platform/plist/PlistCodec.h"

namespace vtc::prefs {

namespace {

Value valueInFile(const std::string& path, std::string_view key) {
  std::optional<Value> root = plist::readFile(path);
  if (!root || !root->isDictionary()) return {};
  return root->dictionary().get(key);
}

}  // namespace

std::string byHostIdentifier() {
  std::ifstream in("/etc/machine-id");
  std::string id;
  std::getline(in, id);
  while (!id.empty() && (id.back() == ' ' || id.back() == '\n' || id.back() == '\r')) id.pop_back();
  return id;
}

std::string perUserFile(std::string_view domain) {
  return paths::expandTilde("~/Library/Preferences/" + std::string(domain) + ".plist");
}

std::string perHostFile(std::string_view domain) {
  return paths::expandTilde("~/Library/Preferences/ByHost/" + std::string(domain) + "." +
                            byHostIdentifier() + ".plist");
}

Value copyAppValue(std::string_view key, std::string_view domain) {
  Value v = valueInFile(perHostFile(domain), key);
  if (!v.isNone()) return v;
  return valueInFile(perUserFile(domain), key);
}

}  // namespace vtc::prefs
