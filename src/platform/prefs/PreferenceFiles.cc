#include "platform/prefs/PreferenceFiles.h"

#include "platform/fs/LocalPaths.h"
#include "platform/os/HostIdentity.h"
#include "platform/prefs/PreferenceStore.h"

namespace vtc::prefs {

std::string byHostIdentifier() {
  return os::machineId();
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
