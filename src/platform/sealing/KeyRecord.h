// The account key wrapped with a passphrase, as the share keeps it: a
// property list with the Argon2id salt and limits beside the wrapped key.
// The passphrase key is Argon2id of the passphrase; the wrap is
// XChaCha20-Poly1305, so a wrong passphrase fails its tag.
#pragma once

#include <optional>
#include <string>

#include "VantorSyncManager/Value.h"
#include "platform/sealing/SecretKey.h"

namespace vtc::sealing {

struct KeyDerivationLimits {
  uint64_t operations;
  uint64_t memoryBytes;
  // libsodium's interactive limits: two passes over 64 MiB.
  static KeyDerivationLimits interactive();
};

// The record of key wrapped with passphrase, under a new salt and nonce.
Dictionary wrapKey(const SecretKey& key, const std::string& passphrase,
                   const KeyDerivationLimits& limits = KeyDerivationLimits::interactive());

// The account key, or nullopt when the passphrase does not open the
// record. A record that is malformed, or whose limits are out of bounds (a
// share could ask for any amount of memory), raises std::runtime_error with
// a sentence saying so.
std::optional<SecretKey> unwrapKey(const Dictionary& record, const std::string& passphrase);

}  // namespace vtc::sealing
