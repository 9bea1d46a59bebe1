// The credential store: generic password items of the Secret Service
// (attributes "service" and "account"), as `secret-tool store --label=Nubilo
// service Kitbag account NAME` writes them.
#pragma once

#include <optional>
#include <string>

namespace vtc::secrets {

// The item's password, or nullopt when there is none or no Secret Service
// can be reached; *why then says which.
std::optional<std::string> findGenericPassword(const std::string& service,
                                               const std::string& account,
                                               std::string* why = nullptr);

// Stores (or replaces) the item in the default collection; false with *why
// on failure.
bool storeGenericPassword(const std::string& service, const std::string& account,
                          const std::string& label, const std::string& password,
                          std::string* why = nullptr);

}  // namespace vtc::secrets
