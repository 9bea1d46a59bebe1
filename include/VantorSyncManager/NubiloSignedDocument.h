// Signed documents: a payload, the marker "----BEGIN RSA SIGNATURE----\n" and
// a raw RSASSA-PKCS1-v1_5 signature over the SHA-1 digest of the payload.
// Keys are DER bytes: an X.509 SubjectPublicKeyInfo for verifying, a PKCS#1
// RSAPrivateKey (or PKCS#8) for signing. Nothing here raises.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>

#include "VantorSyncManager/Export.h"
#include "VantorSyncManager/Value.h"

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
