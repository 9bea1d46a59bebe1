// The account stored on this computer: the member name in the preferences
// ("KitbagMember") and its password in the credential store (service
// "Kitbag", account = member name).
#pragma once

#include <optional>
#include <string>

namespace vtc {

inline constexpr const char* kAccountNameKey = "KitbagMember";
inline constexpr const char* kCredentialService = "Kitbag";

std::optional<std::string> storedMemberName();

// The member's password, or nullopt; an Error line then says how to store it.
std::optional<std::string> storedPassword(const std::string& memberName);

}  // namespace vtc
