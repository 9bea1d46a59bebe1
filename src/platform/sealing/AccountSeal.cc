#include "platform/sealing/AccountSeal.h"

#include <sodium.h>

#include <algorithm>
#include <istream>
#include <ostream>
#include <sstream>
#include <stdexcept>

#include "changelog/ChangeLogEnvelope.h"
#include "common/Format.h"

namespace vtc::sealing {

namespace {

constexpr size_t kNonce = crypto_aead_xchacha20poly1305_ietf_NPUBBYTES;
constexpr size_t kTag = crypto_aead_xchacha20poly1305_ietf_ABYTES;
constexpr char kSubkeyContext[crypto_kdf_CONTEXTBYTES + 1] = "nubiloac";
constexpr uint64_t kNonceSubkey = 1;
// A changelog is sealed in pieces of this many bytes, each with its tag.
constexpr size_t kPiece = 64 * 1024;
constexpr size_t kStreamTag = crypto_secretstream_xchacha20poly1305_ABYTES;
// The envelope's index and headers fit in this many bytes.
constexpr size_t kLargestEnvelope = 4096;

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

void AccountSeal::sealChangeLog(std::istream& changelog, uint64_t size, std::ostream& out,
                                const std::string& dataclass, int64_t index,
                                const Dictionary& envelopeHeaders) const {
  Dictionary headers = envelopeHeaders;
  headers.set(clog::kBodyEncryptionHeader, Value(kChangeLogEncryption));
  // The envelope is authenticated with the body: it is read before the key
  // opens anything, but changed it fails like the body.
  const Bytes head = clog::envelopeHead(std::move(headers));
  const std::string place = changeLogPlace(dataclass, index, head);
  crypto_secretstream_xchacha20poly1305_state state;
  uint8_t streamHeader[crypto_secretstream_xchacha20poly1305_HEADERBYTES];
  ::crypto_secretstream_xchacha20poly1305_init_push(&state, streamHeader, key_.data());
  out.write(reinterpret_cast<const char*>(head.data()), static_cast<std::streamsize>(head.size()));
  out.write(reinterpret_cast<const char*>(streamHeader), sizeof streamHeader);
  Bytes piece(kPiece), sealed(kPiece + kStreamTag);
  uint64_t left = size;
  do {
    const size_t n = static_cast<size_t>(std::min<uint64_t>(left, kPiece));
    if (!changelog.read(reinterpret_cast<char*>(piece.data()), static_cast<std::streamsize>(n)))
      throw std::runtime_error("the changelog to seal could not be read");
    left -= n;
    unsigned long long written = 0;
    ::crypto_secretstream_xchacha20poly1305_push(
        &state, sealed.data(), &written, piece.data(), n, bytesOf(place), place.size(),
        left == 0 ? crypto_secretstream_xchacha20poly1305_TAG_FINAL : 0);
    out.write(reinterpret_cast<const char*>(sealed.data()), static_cast<std::streamsize>(written));
  } while (left > 0);
  sodium_memzero(piece.data(), piece.size());
  if (!out) throw std::runtime_error("the sealed changelog could not be written");
}

void AccountSeal::openChangeLog(std::istream& stored, std::ostream& out,
                                const std::string& dataclass, int64_t index) const {
  // The envelope is small: it is found in the first bytes.
  Bytes prefix(kLargestEnvelope);
  stored.read(reinterpret_cast<char*>(prefix.data()), static_cast<std::streamsize>(prefix.size()));
  prefix.resize(static_cast<size_t>(stored.gcount()));
  stored.clear();
  const std::optional<clog::Envelope> envelope = clog::readEnvelope(prefix);
  if (!envelope)
    throw std::runtime_error("it is not encrypted, and this account encrypts every changelog");
  const std::string& kind = envelope->headers.get(clog::kBodyEncryptionHeader).string();
  if (kind != kChangeLogEncryption)
    throw std::runtime_error("it is encrypted in a way this program does not know (" + kind + ")");
  const size_t headSize = prefix.size() - envelope->body.size();
  const std::string place = changeLogPlace(dataclass, index, ByteView(prefix).first(headSize));
  const char* const failed =
      "it failed authentication: it was changed, cut or moved on the share, or written with "
      "another key";
  stored.seekg(static_cast<std::streamoff>(headSize));
  uint8_t streamHeader[crypto_secretstream_xchacha20poly1305_HEADERBYTES];
  crypto_secretstream_xchacha20poly1305_state state;
  if (!stored.read(reinterpret_cast<char*>(streamHeader), sizeof streamHeader) ||
      ::crypto_secretstream_xchacha20poly1305_init_pull(&state, streamHeader, key_.data()) != 0)
    throw std::runtime_error(failed);
  Bytes sealed(kPiece + kStreamTag), piece(kPiece);
  for (;;) {
    stored.read(reinterpret_cast<char*>(sealed.data()), static_cast<std::streamsize>(sealed.size()));
    const size_t n = static_cast<size_t>(stored.gcount());
    unsigned long long opened = 0;
    unsigned char tag = 0;
    if (n < kStreamTag ||
        ::crypto_secretstream_xchacha20poly1305_pull(&state, piece.data(), &opened, &tag,
                                                     sealed.data(), n, bytesOf(place),
                                                     place.size()) != 0)
      throw std::runtime_error(failed);
    out.write(reinterpret_cast<const char*>(piece.data()), static_cast<std::streamsize>(opened));
    if (tag == crypto_secretstream_xchacha20poly1305_TAG_FINAL) {
      // Nothing may follow the last piece.
      if (stored.peek() != std::char_traits<char>::eof()) throw std::runtime_error(failed);
      break;
    }
    if (n < sealed.size()) throw std::runtime_error(failed);  // cut short
  }
  sodium_memzero(piece.data(), piece.size());
  if (!out) throw std::runtime_error("the opened changelog could not be written");
}

Bytes AccountSeal::sealChangeLog(ByteView changelog, const std::string& dataclass, int64_t index,
                                 const Dictionary& envelopeHeaders) const {
  std::istringstream in(std::string(changelog.begin(), changelog.end()));
  std::ostringstream out;
  sealChangeLog(in, changelog.size(), out, dataclass, index, envelopeHeaders);
  const std::string text = out.str();
  return Bytes(text.begin(), text.end());
}

Bytes AccountSeal::openChangeLog(ByteView stored, const std::string& dataclass,
                                 int64_t index) const {
  std::istringstream in(std::string(stored.begin(), stored.end()));
  std::ostringstream out;
  openChangeLog(in, out, dataclass, index);
  const std::string text = out.str();
  return Bytes(text.begin(), text.end());
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
