// nubilo-sign-config KEY PAYLOAD OUT: writes a signed configuration document
// (the payload, the signature marker, the RSA SHA-1 signature) for people who
// run their own configuration server. KEY is a DER RSA private key (PKCS#1
// or PKCS#8), PAYLOAD an XML property list.
#include <algorithm>
#include <cstdio>
#include <fstream>
#include <iterator>
#include <optional>

#include "VantorSyncManager/VantorSyncManager.h"

namespace {

std::optional<vtc::Bytes> readFile(const char* path) {
  std::ifstream in(path, std::ios::binary);
  if (!in) return std::nullopt;
  return vtc::Bytes((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
}

}  // namespace

int main(int argc, char** argv) {
  if (argc != 4) {
    std::fprintf(stderr, "usage: nubilo-sign-config KEY.der PAYLOAD.plist OUT\n");
    return 2;
  }
  auto key = readFile(argv[1]);
  auto payload = readFile(argv[2]);
  if (!key || !payload) {
    std::fprintf(stderr, "cannot read %s\n", key ? argv[2] : argv[1]);
    return 1;
  }
  auto parsed = NubiloDictionaryWithData(*payload);
  if (!parsed || !parsed->isDictionary()) {
    std::fprintf(stderr, "%s is not a property-list dictionary\n", argv[2]);
    return 1;
  }
  if (payload->size() < 29 || std::find(payload->begin(), payload->end(), 0) != payload->end()) {
    std::fprintf(stderr, "%s must be at least 29 bytes long and hold no zero byte\n", argv[2]);
    return 1;
  }
  auto signature = NubiloSignatureWithKey(*payload, key->data(), key->size());
  if (!signature) {
    std::fprintf(stderr, "%s is not an RSA private key in DER form\n", argv[1]);
    return 1;
  }
  vtc::Bytes document = *payload;
  NubiloAppendSignature(document, *signature);
  std::ofstream out(argv[3], std::ios::binary | std::ios::trunc);
  out.write(reinterpret_cast<const char*>(document.data()),
            static_cast<std::streamsize>(document.size()));
  if (!out) {
    std::fprintf(stderr, "cannot write %s\n", argv[3]);
    return 1;
  }
  std::printf("signed %s (%zu bytes) into %s\n", argv[2], payload->size(), argv[3]);
  return 0;
}
