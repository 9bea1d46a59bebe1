#include "support/KeyPair.h"

#include <openssl/evp.h>
#include <openssl/rsa.h>
#include <openssl/x509.h>

#include <stdexcept>

namespace vtc::test {

KeyPair::KeyPair(unsigned bits) {
  EVP_PKEY* key = EVP_RSA_gen(bits);
  if (!key) throw std::runtime_error("cannot make an RSA key");
  unsigned char* out = nullptr;
  int n = i2d_PUBKEY(key, &out);
  publicKey.assign(out, out + n);
  OPENSSL_free(out);
  out = nullptr;
  n = i2d_PrivateKey(key, &out);
  privateKey.assign(out, out + n);
  OPENSSL_free(out);
  EVP_PKEY_free(key);
}

}  // namespace vtc::test
