#include "platform/sealing/AccountSeal.h"

#include <sodium.h>

#include <stdexcept>

#include "changelog/ChangeLogEnvelope.h"
#include "common/Format.h"

namespace vtc::sealing {

namespace {

constexpr size_t kNonce = crypto_aead_xchacha20poly1305_ietf_NPUBBYTES;
constexpr size_t kTag = crypto_aead_xchacha20poly1305_ietf_ABYTES;
constexpr char kSubkeyContext[crypto_kdf_CONTEXTBYTES + 1] = "nubiloac";
constexpr uint64_t kNonceSubkey = 1;

const uint8_t* bytesOf(const std::string& text) {
  return reinterpret_cast<const uint8_t*>(text.data());
}

// What a changelog's body is bound to: its format, dataclass and number,
// and the envelope around it.
std::string changeLogPlace(const std::string& dataclass, int64_t index, ByteView head) {
  return format("changelog/1\n%@\n%05lld\n", dataclass, static_cast<long long>(index)) +
         std::string(head.begin(), head.end());
}

std::string base64(ByteView bytes) {
  std::string text(sodium_base64_ENCODED_LEN(bytes.size(), sodium_base64_VARIANT_ORIGINAL), '\0');
  ::sodium_bin2base64(text.data(), text.size(), bytes.data(), bytes.size(),
                      sodium_base64_VARIANT_ORIGINAL);
  text.resize(text.size() - 1);
  return text;
}

}  // namespace

AccountSeal::AccountSeal(SecretKey key) : key_(std::move(key)), nonceKey_(SecretKey::random()) {
  ::crypto_kdf_derive_from_key(nonceKey_.writableData(), SecretKey::kSize, kNonceSubkey,
                               kSubkeyContext, key_.data());
}

Bytes AccountSeal::encrypt(ByteView plain, const std::string& associated, ByteView nonce) const {
  Bytes out(kNonce + plain.size() + kTag);
  std::copy(nonce.begin(), nonce.end(), out.begin());
  ::crypto_aead_xchacha20poly1305_ietf_encrypt(out.data() + kNonce, nullptr, plain.data(),
                                               plain.size(), bytesOf(associated), associated.size(),
                                               nullptr, nonce.data(), key_.data());
  return out;
}

Bytes AccountSeal::seal(ByteView plain, const std::string& purpose) const {
  uint8_t nonce[kNonce];
  ::randombytes_buf(nonce, sizeof nonce);
  return encrypt(plain, purpose, nonce);
}

std::optional<Bytes> AccountSeal::open(ByteView sealed, const std::string& purpose) const {
  if (sealed.size() < kNonce + kTag) return std::nullopt;
  Bytes plain(sealed.size() - kNonce - kTag);
  if (::crypto_aead_xchacha20poly1305_ietf_decrypt(
          plain.data(), nullptr, nullptr, sealed.data() + kNonce, sealed.size() - kNonce,
          bytesOf(purpose), purpose.size(), sealed.data(), key_.data()) != 0)
    return std::nullopt;
  return plain;
}

Bytes AccountSeal::sealChangeLog(ByteView changelog, const std::string& dataclass, int64_t index,
                                 const Dictionary& envelopeHeaders) const {
  Dictionary headers = envelopeHeaders;
  headers.set(clog::kBodyEncryptionHeader, Value(kChangeLogEncryption));
  // The envelope is authenticated with the body: it is read before the key
  // opens anything, but changed it fails like the body.
  Bytes out = clog::envelopeHead(std::move(headers));
  const Bytes body = seal(changelog, changeLogPlace(dataclass, index, out));
  out.insert(out.end(), body.begin(), body.end());
  return out;
}

Bytes AccountSeal::openChangeLog(ByteView stored, const std::string& dataclass,
                                 int64_t index) const {
  const std::optional<clog::Envelope> envelope = clog::readEnvelope(stored);
  if (!envelope)
    throw std::runtime_error("it is not encrypted, and this account encrypts every changelog");
  const std::string& kind = envelope->headers.get(clog::kBodyEncryptionHeader).string();
  if (kind != kChangeLogEncryption)
    throw std::runtime_error("it is encrypted in a way this program does not know (" + kind + ")");
  const ByteView head = stored.first(stored.size() - envelope->body.size());
  std::optional<Bytes> plain = open(envelope->body, changeLogPlace(dataclass, index, head));
  if (!plain)
    throw std::runtime_error(
        "it failed authentication: it was changed, cut or moved on the share, or written "
        "with another key");
  return std::move(*plain);
}

std::string AccountSeal::sealText(const std::string& text, const std::string& purpose) const {
  uint8_t nonce[kNonce];
  const std::string keyed = purpose + '\0' + text;
  ::crypto_generichash(nonce, sizeof nonce, bytesOf(keyed), keyed.size(), nonceKey_.data(),
                       SecretKey::kSize);
  return kSealedTextPrefix + base64(encrypt(ByteView(bytesOf(text), text.size()), purpose, nonce));
}

std::optional<std::string> AccountSeal::openText(const std::string& sealed,
                                                 const std::string& purpose) const {
  if (!isSealedText(sealed)) return std::nullopt;
  const std::string encoded = sealed.substr(std::char_traits<char>::length(kSealedTextPrefix));
  Bytes bytes(encoded.size());
  size_t length = 0;
  if (::sodium_base642bin(bytes.data(), bytes.size(), encoded.data(), encoded.size(), nullptr,
                          &length, nullptr, sodium_base64_VARIANT_ORIGINAL) != 0)
    return std::nullopt;
  bytes.resize(length);
  std::optional<Bytes> plain = open(bytes, purpose);
  if (!plain) return std::nullopt;
  return std::string(plain->begin(), plain->end());
}

bool isSealedText(const std::string& text) {
  return text.starts_with(kSealedTextPrefix);
}

}  // namespace vtc::sealing
