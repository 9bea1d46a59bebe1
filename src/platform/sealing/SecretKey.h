// A 32-byte key in libsodium's guarded memory: locked (never swapped),
// fenced by guard pages, and wiped when freed. Holding one keeps the
// process undumpable (SecretHold). Move-only.
#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "VantorSyncManager/Value.h"
#include "common/SecretMemory.h"

namespace vtc::sealing {

class SecretKey {
 public:
  static constexpr size_t kSize = 32;

  // A new random key.
  static SecretKey random();
  // A copy of bytes, which must be kSize long (std::invalid_argument).
  static SecretKey fromBytes(ByteView bytes);
  // From toText()'s form; nullopt for anything else.
  static std::optional<SecretKey> fromText(const std::string& text);

  SecretKey(SecretKey&& other) noexcept;
  SecretKey& operator=(SecretKey&& other) noexcept;
  SecretKey(const SecretKey&) = delete;
  SecretKey& operator=(const SecretKey&) = delete;
  ~SecretKey();

  const uint8_t* data() const { return bytes_; }
  uint8_t* writableData() { return bytes_; }
  // Base64, for a credential store; the caller wipes it (vtc::wipe).
  std::string toText() const;

 private:
  SecretKey();
  uint8_t* bytes_ = nullptr;
  SecretHold hold_;
};

// Initialises libsodium once; raises std::runtime_error when it cannot.
void requireSodium();

}  // namespace vtc::sealing
