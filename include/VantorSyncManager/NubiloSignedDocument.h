// Signed documents: a payload, the marker "----BEGIN RSA SIGNATURE----\n" and
// a raw RSASSA-PKCS1-v1_5 signature over the SHA-1 digest of the payload.
// Keys are DER bytes: an X.509 SubjectPublicKeyInfo for verifying, a PKCS#1
// RSAPrivateKey (or PKCS#8) for signing. Nothing here raises.
#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>

#include "VantorSyncManager/Export.h"
#include "VantorSyncManager/Value.h"

struct evp_pkey_st;  // the key type of the signature library

namespace vtc {

enum class KeyClass { Public, Private };

struct VSM_EXPORT KeyFree {
  void operator()(evp_pkey_st* key) const;
};
// An RSA key held in memory only.
using Key = std::unique_ptr<evp_pkey_st, KeyFree>;

}  // namespace vtc

// Imports an RSA key of the given class from its DER bytes (a public key as an
// X.509 SubjectPublicKeyInfo, a private one as PKCS#1 or PKCS#8) into key.
// Whether a key was made; key is empty when not.
VSM_EXPORT bool keyWithBytes(vtc::ByteView bytes, vtc::Key& key, vtc::KeyClass keyClass);

// Appends the marker and the signature to the payload.
VSM_EXPORT void NubiloAppendSignature(vtc::Bytes& payload, vtc::ByteView signature);

// Cuts document back to its payload and returns the signature; nothing (and
// an Error line) when the marker is missing or the payload is shorter than
// 29 bytes, the document then left as it was.
VSM_EXPORT std::optional<vtc::Bytes> NubiloStripSignature(vtc::Bytes& document);

// True only when signature is valid for payload under the public key.
VSM_EXPORT bool NubiloVerifySignature(vtc::ByteView payload, vtc::ByteView signature,
                                      const uint8_t* key, size_t keyLength);

// The signature of payload under the private key, or nothing.
VSM_EXPORT std::optional<vtc::Bytes> NubiloSignatureWithKey(vtc::ByteView payload,
                                                            const uint8_t* key, size_t keyLength);
