// Signed documents: splitting, signing and verifying with keys made here.
#include <gtest/gtest.h>

#include <openssl/evp.h>
#include <openssl/x509.h>

#include "VantorSyncManager/NubiloSignedDocument.h"
#include "support/KeyPair.h"

using vtc::Bytes;

namespace {

Bytes text(const std::string& s) {
  return Bytes(s.begin(), s.end());
}
const std::string kMarker = "----BEGIN RSA SIGNATURE----\n";

TEST(SignedDocument, SplitsAtTheFirstMarkerAfterAPayloadOfAtLeast29Bytes) {
  Bytes doc = text(std::string(29, 'p') + kMarker + "sig" + kMarker + "more");
  auto signature = NubiloStripSignature(doc);
  ASSERT_TRUE(signature);
  EXPECT_EQ(doc, text(std::string(29, 'p')));
  EXPECT_EQ(*signature, text("sig" + kMarker + "more"));

  Bytes shortDoc = text(std::string(28, 'p') + kMarker + "sig");
  EXPECT_FALSE(NubiloStripSignature(shortDoc));
  EXPECT_EQ(shortDoc.size(), 28 + kMarker.size() + 3);  // left as it was

  Bytes zero = text(std::string(30, 'p') + kMarker + "sig");
  zero[5] = 0;  // the search stops at the zero byte
  EXPECT_FALSE(NubiloStripSignature(zero));
  Bytes none = text(std::string(40, 'p'));
  EXPECT_FALSE(NubiloStripSignature(none));

  Bytes bare = text(std::string(30, 'p') + kMarker);
  auto empty = NubiloStripSignature(bare);
  ASSERT_TRUE(empty);
  EXPECT_TRUE(empty->empty());
}

TEST(SignedDocument, SignsAndVerifiesAndRefusesAnyChange) {
  vtc::test::KeyPair keys(512);
  Bytes payload = text("<plist><dict><key>a</key><integer>1</integer></dict></plist>");
  auto signature = NubiloSignatureWithKey(payload, keys.privateKey.data(), keys.privateKey.size());
  ASSERT_TRUE(signature);
  EXPECT_EQ(signature->size(), 64u);
  EXPECT_EQ(keys.publicKey.size(), 94u);

  Bytes doc = payload;
  NubiloAppendSignature(doc, *signature);
  auto stripped = NubiloStripSignature(doc);
  ASSERT_TRUE(stripped);
  EXPECT_EQ(doc, payload);
  EXPECT_TRUE(NubiloVerifySignature(doc, *stripped, keys.publicKey.data(), keys.publicKey.size()));

  Bytes changed = payload;
  changed[3] ^= 1;
  EXPECT_FALSE(
      NubiloVerifySignature(changed, *stripped, keys.publicKey.data(), keys.publicKey.size()));
  vtc::test::KeyPair other(512);
  EXPECT_FALSE(
      NubiloVerifySignature(doc, *stripped, other.publicKey.data(), other.publicKey.size()));
  EXPECT_FALSE(NubiloVerifySignature(doc, Bytes{}, keys.publicKey.data(), keys.publicKey.size()));
  EXPECT_FALSE(NubiloVerifySignature(doc, *stripped, payload.data(), payload.size()));  // no key
  EXPECT_FALSE(NubiloSignatureWithKey(payload, payload.data(), payload.size()));
}

TEST(SignedDocument, KeysAreImportedByClassFromTheirBytes) {
  vtc::test::KeyPair keys(512);
  vtc::Key key;
  EXPECT_TRUE(keyWithBytes(keys.publicKey, key, vtc::KeyClass::Public));
  EXPECT_EQ(EVP_PKEY_get_bits(key.get()), 512);
  vtc::test::KeyPair other(1024);
  EXPECT_TRUE(keyWithBytes(other.privateKey, key, vtc::KeyClass::Private));
  EXPECT_EQ(EVP_PKEY_get_bits(key.get()), 1024);
  // Bytes of the other class, or no key at all, make no key and clear it.
  EXPECT_FALSE(keyWithBytes(keys.publicKey, key, vtc::KeyClass::Private));
  EXPECT_EQ(key, nullptr);
  EXPECT_FALSE(keyWithBytes(keys.privateKey, key, vtc::KeyClass::Public));
  EXPECT_FALSE(keyWithBytes(text("not a key"), key, vtc::KeyClass::Public));
  EXPECT_FALSE(keyWithBytes(Bytes{}, key, vtc::KeyClass::Public));
}

}  // namespace
