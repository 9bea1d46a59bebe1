// The public key that verifies the downloaded configuration (94 bytes of
// DER SubjectPublicKeyInfo, RSA 512, exponent 65537).
#pragma once

#include <cstddef>
#include <cstdint>

namespace vtc::config {

extern const uint8_t kConfigurationKey[];
extern const size_t kConfigurationKeyLength;

}  // namespace vtc::config
