#include "platform/dav/ServerCertificate.h"

#include <ne_alloc.h>
#include <ne_session.h>
#include <ne_string.h>
#include <openssl/x509.h>
#include <openssl/x509_vfy.h>

#include <memory>

namespace vtc {

namespace {

struct X509Free {
  void operator()(X509* x) const { X509_free(x); }
};
using X509Ptr = std::unique_ptr<X509, X509Free>;

X509Ptr toX509(const ne_ssl_certificate* cert) {
  char* pem = ne_ssl_cert_export(cert);  // base64 of the DER form
  if (!pem) return nullptr;
  unsigned char* der = nullptr;
  const size_t length = ne_unbase64(pem, &der);
  ne_free(pem);
  if (length == 0) return nullptr;
  const unsigned char* cursor = der;
  X509Ptr x509(d2i_X509(nullptr, &cursor, static_cast<long>(length)));
  ne_free(der);
  return x509;
}

}  // namespace

std::string certificateDigest(const ne_ssl_certificate* cert) {
  char* digest = ne_ssl_cert_hdigest(cert, NE_HASH_SHA256 | NE_HASH_COLON);
  std::string out = digest ? digest : "";
  ne_free(digest);
  return out;
}

bool authoritiesVouchFor(const ne_ssl_certificate* cert, const std::string& caFile) {
  X509Ptr leaf = toX509(cert);
  if (!leaf) return false;
  std::unique_ptr<X509_STORE, decltype(&X509_STORE_free)> store(X509_STORE_new(), &X509_STORE_free);
  X509_STORE_set_default_paths(store.get());
  if (!caFile.empty() && X509_STORE_load_file(store.get(), caFile.c_str()) != 1) return false;
  std::unique_ptr<STACK_OF(X509), void (*)(STACK_OF(X509)*)> chain(
      sk_X509_new_null(), [](STACK_OF(X509) * s) { sk_X509_pop_free(s, X509_free); });
  for (const ne_ssl_certificate* c = ne_ssl_cert_signedby(cert); c; c = ne_ssl_cert_signedby(c))
    if (X509Ptr x = toX509(c)) sk_X509_push(chain.get(), x.release());
  std::unique_ptr<X509_STORE_CTX, decltype(&X509_STORE_CTX_free)> context(X509_STORE_CTX_new(),
                                                                          &X509_STORE_CTX_free);
  if (X509_STORE_CTX_init(context.get(), store.get(), leaf.get(), chain.get()) != 1) return false;
  return X509_verify_cert(context.get()) == 1;
}

std::optional<CertificateRefusal> judgeCertificate(const CertificateTrust& trust, int failures,
                                                   const ne_ssl_certificate* cert) {
  // The connection trusts no authority itself, so every certificate comes
  // here as untrusted; any other failure stands.
  if ((failures & ~NE_SSL_UNTRUSTED) != 0) return CertificateRefusal::Invalid;
  if (!trust.pinnedDigest.empty()) {
    if (certificateDigest(cert) == trust.pinnedDigest) return std::nullopt;
    return CertificateRefusal::Changed;
  }
  if (authoritiesVouchFor(cert, trust.caFile)) return std::nullopt;
  return CertificateRefusal::Untrusted;
}

}  // namespace vtc
