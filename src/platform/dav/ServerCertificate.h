// Trust in an HTTPS server's certificate. A connection trusts what the
// system's authorities vouch for, and one more authority when named; or,
// once a certificate is pinned, that certificate alone. Either way it notes
// the digest of the certificate it was shown, for the caller to pin, and why
// it refused one.
#pragma once

#include <ne_ssl.h>

#include <optional>
#include <string>

namespace vtc {

struct CertificateTrust {
  std::string caFile;        // an authority's certificate (PEM) to trust besides the system's
  std::string pinnedDigest;  // the only certificate to trust, as certificateDigest() gives it
};

// Why a certificate was refused.
enum class CertificateRefusal {
  Untrusted,  // no trusted authority vouches for it
  Changed,    // it is not the pinned one
  Invalid,    // expired, not yet valid, issued to another name, or its chain is broken
};

// The SHA-256 digest of a certificate, as colon-separated hex pairs.
std::string certificateDigest(const ne_ssl_certificate* cert);

// Whether the authorities (the system's, and caFile's when given) vouch for
// the certificate, with the chain the server presented after it.
bool authoritiesVouchFor(const ne_ssl_certificate* cert, const std::string& caFile);

// The verdict on a certificate that neon could not verify by itself
// (failures: neon's NE_SSL_* bits); none when it is to be trusted.
std::optional<CertificateRefusal> judgeCertificate(const CertificateTrust& trust, int failures,
                                                   const ne_ssl_certificate* cert);

}  // namespace vtc
