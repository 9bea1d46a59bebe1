// The seam through which the preference store hands the stored account
// (member name and password) to MemberAccount.
#pragma once

#include <functional>
#include <optional>
#include <string>

namespace vtc {

struct StoredCredentials {
  std::string name;
  std::string password;
};

using StoredAccountLookup = std::function<std::optional<StoredCredentials>()>;

// Installs the lookup; an empty function means no stored account.
void setStoredAccountLookup(StoredAccountLookup lookup);
std::optional<StoredCredentials> lookUpStoredAccount();

}  // namespace vtc
