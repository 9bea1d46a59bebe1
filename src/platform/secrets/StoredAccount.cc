#include "platform/secrets/StoredAccount.h"

#include "VantorSyncManager/PublicNames.h"
#include "common/Logging.h"
#include "platform/prefs/PreferenceStore.h"
#include "platform/secrets/CredentialStore.h"

namespace vtc {

std::optional<std::string> storedMemberName() {
  Value name = prefs::PreferenceStore::shared().copyAppValue(kAccountNameKey, kVantorDefaultsKey);
  if (!name.isString() || name.string().empty()) return std::nullopt;
  return name.string();
}

std::optional<std::string> storedPassword(const std::string& memberName) {
  std::string why;
  auto password = secrets::findGenericPassword(kCredentialService, memberName, &why);
  if (!password) {
    VTC_LOG_ERROR(
        "No password for %@ in the credential store (%@); store it with: secret-tool store "
        "--label=Nubilo service Kitbag account %@",
        memberName, why, memberName);
  }
  return password;
}

}  // namespace vtc
