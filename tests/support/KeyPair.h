// An RSA key pair made for a test, as DER bytes: the public key as an X.509
// SubjectPublicKeyInfo, the private key as PKCS#1.
#pragma once

#include "VantorSyncManager/Value.h"

namespace vtc::test {

struct KeyPair {
  explicit KeyPair(unsigned bits);
  Bytes publicKey;
  Bytes privateKey;
};

}  // namespace vtc::test
