#include "platform/prefs/PreferenceFiles.h"

#include <fstream>

#include "platform/fs/LocalPaths.h"
#include "platform/prefs/PreferenceStore.h"

namespace vtc::prefs {

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
  return PreferenceStore::shared().copyAppValue(key, domain);
}

}  // namespace vtc::prefs
