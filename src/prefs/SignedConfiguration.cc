// The signed layer of the configuration: split, verified with the built-in
// key (or one a test installs), parsed.
#include <mutex>

#include "VantorSyncManager/NubiloDataAdditions.h"
#include "VantorSyncManager/NubiloSignedDocument.h"
#include "prefs/ClientConfiguration.h"
#include "prefs/ConfigurationKey.h"

namespace vtc::config {

namespace {
std::mutex gKeyMutex;
std::optional<Bytes> gKeyOverride;
}  // namespace

void setVerificationKeyForTesting(std::optional<Bytes> key) {
  std::lock_guard<std::mutex> lock(gKeyMutex);
  gKeyOverride = std::move(key);
}

std::optional<Dictionary> verifiedConfiguration(const Bytes& signedDocument) {
  Bytes payload = signedDocument;
  std::optional<Bytes> signature = NubiloStripSignature(payload);
  if (!signature) return std::nullopt;
  Bytes key(kConfigurationKey, kConfigurationKey + kConfigurationKeyLength);
  {
    std::lock_guard<std::mutex> lock(gKeyMutex);
    if (gKeyOverride) key = *gKeyOverride;
  }
  if (!NubiloVerifySignature(payload, *signature, key.data(), key.size())) return std::nullopt;
  // A verified payload that is no dictionary has no entries to add. Its
  // signature is good, so it is not reported as a bad one; the layers below
  // serve, as the configuration's rules have it, without a message.
  std::optional<Value> parsed = NubiloDictionaryWithData(payload);
  if (!parsed || !parsed->isDictionary()) return Dictionary{};
  return parsed->dictionary();
}

}  // namespace vtc::config
