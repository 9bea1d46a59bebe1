#include "platform/sealing/SecretKey.h"

#include <sodium.h>

#include <stdexcept>
#include <utility>

namespace vtc::sealing {

void requireSodium() {
  if (::sodium_init() < 0) throw std::runtime_error("libsodium could not be initialised");
}

SecretKey::SecretKey() {
  requireSodium();
  bytes_ = static_cast<uint8_t*>(::sodium_malloc(kSize));
  if (!bytes_) throw std::bad_alloc();
}

SecretKey SecretKey::random() {
  SecretKey key;
  ::randombytes_buf(key.bytes_, kSize);
  return key;
}

SecretKey SecretKey::fromBytes(ByteView bytes) {
  if (bytes.size() != kSize) throw std::invalid_argument("a key is 32 bytes");
  SecretKey key;
  std::copy(bytes.begin(), bytes.end(), key.bytes_);
  return key;
}

std::optional<SecretKey> SecretKey::fromText(const std::string& text) {
  SecretKey key;
  size_t length = 0;
  if (::sodium_base642bin(key.bytes_, kSize, text.data(), text.size(), nullptr, &length, nullptr,
                          sodium_base64_VARIANT_ORIGINAL) != 0 ||
      length != kSize)
    return std::nullopt;
  return key;
}

SecretKey::SecretKey(SecretKey&& other) noexcept : bytes_(std::exchange(other.bytes_, nullptr)) {}

SecretKey& SecretKey::operator=(SecretKey&& other) noexcept {
  if (this != &other) {
    if (bytes_) ::sodium_free(bytes_);
    bytes_ = std::exchange(other.bytes_, nullptr);
  }
  return *this;
}

SecretKey::~SecretKey() {
  if (bytes_) ::sodium_free(bytes_);  // wipes before it frees
}

std::string SecretKey::toText() const {
  std::string text(sodium_base64_ENCODED_LEN(kSize, sodium_base64_VARIANT_ORIGINAL), '\0');
  ::sodium_bin2base64(text.data(), text.size(), bytes_, kSize, sodium_base64_VARIANT_ORIGINAL);
  text.resize(text.size() - 1);  // the terminating zero
  return text;
}

}  // namespace vtc::sealing
