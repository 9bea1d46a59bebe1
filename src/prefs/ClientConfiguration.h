// Pieces of the client configuration that its tests reach directly.
#pragma once

#include <optional>
#include <string>
#include <vector>

#include "VantorSyncManager/Value.h"

namespace vtc::config {

// Keys never taken from the per-host preferences of an external computer.
extern const std::vector<std::string> kProtectedKeys;

// The per-user preference key naming the configuration server ("host" or
// "host:port"); the built-in kConfigHost when absent.
inline constexpr const char* kConfigurationHostKey = "ConfigurationHost";
// The cache file, in the caches folder.
inline constexpr const char* kCacheFileName = "com.korvo.nubilo.configuration";

// The defaults, in table order, ending at the first absent value.
Dictionary builtInDefaults(const std::optional<std::string>& clientGuid,
                           const std::optional<std::string>& memberName);

// http://<host>/configurations/internetservices/syncworks/clientConfiguration-<version>
// with "?osBuildVersion=<build>" when the build is known.
std::string configurationURL(const std::string& host, const std::optional<std::string>& version,
                             const std::optional<std::string>& build);

// The signed document's payload parsed as a dictionary when its signature
// verifies with the built-in key (empty when the payload is no dictionary);
// nothing when the signature is missing or does not verify.
std::optional<Dictionary> verifiedConfiguration(const Bytes& signedDocument);

// Verifies with this DER public key instead of the built-in one; nothing
// restores the built-in key (tests only).
void setVerificationKeyForTesting(std::optional<Bytes> key);

}  // namespace vtc::config
