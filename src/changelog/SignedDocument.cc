#include <openssl/err.h>
#include <openssl/evp.h>
#include <openssl/x509.h>

#include <algorithm>
#include <cstring>
#include <memory>
#include <string_view>

#include "VantorSyncManager/NubiloSignedDocument.h"
#include "common/Logging.h"

namespace {

constexpr std::string_view kMarker = "----BEGIN RSA SIGNATURE----\n";
constexpr size_t kMinimumPayload = 29;

using vtc::Key;
using vtc::KeyClass;

struct ContextFree {
  void operator()(EVP_MD_CTX* c) const { EVP_MD_CTX_free(c); }
};
using Context = std::unique_ptr<EVP_MD_CTX, ContextFree>;

std::string openSslError() {
  char text[256];
  ERR_error_string_n(ERR_get_error(), text, sizeof text);
  ERR_clear_error();
  return text;
}

}  // namespace

void vtc::KeyFree::operator()(evp_pkey_st* key) const {
  EVP_PKEY_free(key);
}

bool keyWithBytes(vtc::ByteView bytes, Key& key, KeyClass keyClass) {
  const unsigned char* p = bytes.data();
  const long length = static_cast<long>(bytes.size());
  key.reset(keyClass == KeyClass::Public ? d2i_PUBKEY(nullptr, &p, length)
                                         : d2i_AutoPrivateKey(nullptr, &p, length));
  if (key && EVP_PKEY_base_id(key.get()) != EVP_PKEY_RSA) key.reset();
  ERR_clear_error();
  return key != nullptr;
}

void NubiloAppendSignature(vtc::Bytes& payload, vtc::ByteView signature) {
  payload.insert(payload.end(), kMarker.begin(), kMarker.end());
  payload.insert(payload.end(), signature.begin(), signature.end());
}

std::optional<vtc::Bytes> NubiloStripSignature(vtc::Bytes& document) {
  // The document is searched as a zero-terminated string, within its bounds.
  auto end = std::find(document.begin(), document.end(), uint8_t{0});
  auto at = std::search(document.begin(), end, kMarker.begin(), kMarker.end());
  size_t p = static_cast<size_t>(at - document.begin());
  if (at == end || p < kMinimumPayload || p >= document.size()) {
    VTC_LOG_ERROR("Failed to validate downloaded config file, signature not found");
    return std::nullopt;
  }
  vtc::Bytes signature(document.begin() + static_cast<std::ptrdiff_t>(p + kMarker.size()),
                       document.end());
  document.resize(p);
  return signature;
}

bool NubiloVerifySignature(vtc::ByteView payload, vtc::ByteView signature, const uint8_t* key,
                           size_t keyLength) {
  Key publicKey;
  if (!key || !keyWithBytes(vtc::ByteView(key, keyLength), publicKey, KeyClass::Public))
    return false;
  Context ctx(EVP_MD_CTX_new());
  if (!ctx || EVP_DigestVerifyInit(ctx.get(), nullptr, EVP_sha1(), nullptr, publicKey.get()) != 1)
    return false;
  int ok = EVP_DigestVerify(ctx.get(), signature.data(), signature.size(), payload.data(),
                            payload.size());
  if (ok < 0) {
    VTC_LOG_ERROR("Failed to validate configuration signature error:%@", openSslError());
    return false;
  }
  ERR_clear_error();  // a plain mismatch leaves an error queued
  return ok == 1;
}

std::optional<vtc::Bytes> NubiloSignatureWithKey(vtc::ByteView payload, const uint8_t* key,
                                                 size_t keyLength) {
  Key privateKey;
  if (!key || !keyWithBytes(vtc::ByteView(key, keyLength), privateKey, KeyClass::Private))
    return std::nullopt;
  Context ctx(EVP_MD_CTX_new());
  if (!ctx || EVP_DigestSignInit(ctx.get(), nullptr, EVP_sha1(), nullptr, privateKey.get()) != 1)
    return std::nullopt;
  size_t length = 0;
  vtc::Bytes signature;
  if (EVP_DigestSign(ctx.get(), nullptr, &length, payload.data(), payload.size()) == 1) {
    signature.resize(length);
    if (EVP_DigestSign(ctx.get(), signature.data(), &length, payload.data(), payload.size()) == 1) {
      signature.resize(length);
      return signature;
    }
  }
  VTC_LOG_ERROR("Failed to validate configuration signature error:%@", openSslError());
  return std::nullopt;
}
