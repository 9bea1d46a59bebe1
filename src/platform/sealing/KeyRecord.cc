#include "platform/sealing/KeyRecord.h"

#include <sodium.h>

#include <stdexcept>

namespace vtc::sealing {

namespace {

constexpr int64_t kFormat = 1;
constexpr const char* kDerivation = "argon2id13";
// What the record's own authentication covers beside the key.
constexpr const char* kWrapPurpose = "nubilo account key/1";
// Bounds on what a record from the share may ask of this computer.
constexpr uint64_t kMostOperations = 16;
constexpr uint64_t kMostMemory = 1024ull * 1024 * 1024;

const Bytes& dataOf(const Dictionary& record, const char* key, size_t size) {
  const Value* v = record.find(key);
  if (!v || v->kind() != Value::Kind::Data || v->data().size() != size)
    throw std::runtime_error(std::string("The account key record on the share is damaged (") + key +
                             ").");
  return v->data();
}

uint64_t limitOf(const Dictionary& record, const char* key, uint64_t least, uint64_t most) {
  const Value* v = record.find(key);
  if (!v || v->kind() != Value::Kind::Integer || v->integer() < static_cast<int64_t>(least) ||
      static_cast<uint64_t>(v->integer()) > most)
    throw std::runtime_error(std::string("The account key record on the share asks for ") + key +
                             " out of bounds; it is damaged or not from this program.");
  return static_cast<uint64_t>(v->integer());
}

// The passphrase key; raises std::bad_alloc when the memory limit cannot
// be had.
SecretKey passphraseKey(const std::string& passphrase, ByteView salt,
                        const KeyDerivationLimits& limits) {
  SecretKey derived = SecretKey::random();
  if (::crypto_pwhash(derived.writableData(), SecretKey::kSize, passphrase.data(),
                      passphrase.size(), salt.data(), limits.operations,
                      static_cast<size_t>(limits.memoryBytes), crypto_pwhash_ALG_ARGON2ID13) != 0)
    throw std::bad_alloc();
  return derived;
}

}  // namespace

KeyDerivationLimits KeyDerivationLimits::interactive() {
  return {crypto_pwhash_OPSLIMIT_INTERACTIVE, crypto_pwhash_MEMLIMIT_INTERACTIVE};
}

Dictionary wrapKey(const SecretKey& key, const std::string& passphrase,
                   const KeyDerivationLimits& limits) {
  requireSodium();
  Bytes salt(crypto_pwhash_SALTBYTES), nonce(crypto_aead_xchacha20poly1305_ietf_NPUBBYTES);
  ::randombytes_buf(salt.data(), salt.size());
  ::randombytes_buf(nonce.data(), nonce.size());
  const SecretKey wrapping = passphraseKey(passphrase, salt, limits);
  Bytes wrapped(SecretKey::kSize + crypto_aead_xchacha20poly1305_ietf_ABYTES);
  const std::string purpose = kWrapPurpose;
  ::crypto_aead_xchacha20poly1305_ietf_encrypt(
      wrapped.data(), nullptr, key.data(), SecretKey::kSize,
      reinterpret_cast<const uint8_t*>(purpose.data()), purpose.size(), nullptr, nonce.data(),
      wrapping.data());
  return Dictionary{{"Format", kFormat},
                    {"KeyDerivation", kDerivation},
                    {"OpsLimit", static_cast<int64_t>(limits.operations)},
                    {"MemLimit", static_cast<int64_t>(limits.memoryBytes)},
                    {"Salt", Value(std::move(salt))},
                    {"Nonce", Value(std::move(nonce))},
                    {"WrappedKey", Value(std::move(wrapped))}};
}

std::optional<SecretKey> unwrapKey(const Dictionary& record, const std::string& passphrase) {
  requireSodium();
  if (record.get("Format") != Value(kFormat) || record.get("KeyDerivation") != Value(kDerivation))
    throw std::runtime_error(
        "The account key record on the share is of a kind this program does not know.");
  const KeyDerivationLimits limits{
      limitOf(record, "OpsLimit", crypto_pwhash_OPSLIMIT_MIN, kMostOperations),
      limitOf(record, "MemLimit", crypto_pwhash_MEMLIMIT_MIN, kMostMemory)};
  const Bytes& salt = dataOf(record, "Salt", crypto_pwhash_SALTBYTES);
  const Bytes& nonce = dataOf(record, "Nonce", crypto_aead_xchacha20poly1305_ietf_NPUBBYTES);
  const Bytes& wrapped =
      dataOf(record, "WrappedKey", SecretKey::kSize + crypto_aead_xchacha20poly1305_ietf_ABYTES);
  const SecretKey wrapping = passphraseKey(passphrase, salt, limits);
  SecretKey key = SecretKey::random();
  const std::string purpose = kWrapPurpose;
  if (::crypto_aead_xchacha20poly1305_ietf_decrypt(
          key.writableData(), nullptr, nullptr, wrapped.data(), wrapped.size(),
          reinterpret_cast<const uint8_t*>(purpose.data()), purpose.size(), nonce.data(),
          wrapping.data()) != 0)
    return std::nullopt;
  return key;
}

}  // namespace vtc::sealing
