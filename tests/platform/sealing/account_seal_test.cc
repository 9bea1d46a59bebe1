// The account key's wrap and the seal of changelogs, reports and names:
// what a wrong passphrase, a hostile key record, and bytes changed or moved
// on the share come to.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "VantorSyncManager/NubiloChangeLog.h"
#include "changelog/ChangeLogEnvelope.h"
#include "platform/sealing/AccountSeal.h"
#include "platform/sealing/KeyRecord.h"
#include "support/TestHome.h"

using testing::HasSubstr;
using vtc::Bytes;
using vtc::Dictionary;
using vtc::Value;
using vtc::sealing::AccountSeal;
using vtc::sealing::SecretKey;

namespace {

// Argon2id at its least, so that the tests do not spend 64 MiB per guess.
const vtc::sealing::KeyDerivationLimits kCheap{1, 8192};

Bytes changelogBytes() {
  NubiloChangeLog log(std::vector<SyncEngineChange>{SyncEngineChange(
      1, "ann-uid",
      vtc::Array{Value(Dictionary{{"action", "set"}, {"name", "FN"}, {"value", "Ann Example"}})})});
  log.setHeaderValue(Value("Mac A"), "CreatorClientName");
  Bytes out;
  log.writeToData(out);
  return out;
}

std::string textOf(const Bytes& b) {
  return std::string(b.begin(), b.end());
}

TEST(AccountKeyRecord, OpensWithItsPassphraseOnlyAndRefusesLimitsNoComputerShouldSpend) {
  const SecretKey key = SecretKey::random();
  Dictionary record = vtc::sealing::wrapKey(key, "correct horse", kCheap);
  auto opened = vtc::sealing::unwrapKey(record, "correct horse");
  ASSERT_TRUE(opened);
  EXPECT_EQ(Bytes(opened->data(), opened->data() + 32), Bytes(key.data(), key.data() + 32));
  EXPECT_FALSE(vtc::sealing::unwrapKey(record, "correct horsE"));

  // A rewrap keeps the key under new salt and nonce.
  Dictionary again = vtc::sealing::wrapKey(key, "new one", kCheap);
  EXPECT_NE(again.get("Salt"), record.get("Salt"));
  EXPECT_TRUE(vtc::sealing::unwrapKey(again, "new one"));

  Dictionary greedy = record;
  greedy.set("MemLimit", Value(int64_t{64} << 30));
  EXPECT_THROW(vtc::sealing::unwrapKey(greedy, "correct horse"), std::runtime_error);
  Dictionary cut = record;
  cut.set("WrappedKey", Value(Bytes(10)));
  EXPECT_THROW(vtc::sealing::unwrapKey(cut, "correct horse"), std::runtime_error);
}

TEST(AccountSealTest, AChangelogOpensOnlyWhereItWasWrittenAndUnchanged) {
  vtc::test::TestHome home;
  const AccountSeal seal(SecretKey::random());
  const Bytes plain = changelogBytes();
  const Bytes sealed =
      seal.sealChangeLog(plain, "com.korvo.Contacts", 7, Dictionary{{"CreatorClientGuid", "g-1"}});
  EXPECT_EQ(textOf(sealed).find("Ann Example"), std::string::npos);
  EXPECT_EQ(textOf(sealed).find("ann-uid"), std::string::npos);
  EXPECT_EQ(textOf(sealed).find("Mac A"), std::string::npos);

  // Every reader of the format reads the envelope as a changelog without
  // changes; its headers say what it is.
  NubiloChangeLog envelope(sealed);
  EXPECT_TRUE(envelope.changes().empty());
  EXPECT_EQ(envelope.headerValueForKey("BodyEncryption"), Value("xchacha20poly1305-ietf/1"));
  EXPECT_EQ(envelope.headerValueForKey("CreatorClientGuid"), Value("g-1"));

  EXPECT_EQ(seal.openChangeLog(sealed, "com.korvo.Contacts", 7), plain);
  EXPECT_THAT([&] { seal.openChangeLog(sealed, "com.korvo.Contacts", 8); },
              testing::ThrowsMessage<std::runtime_error>(HasSubstr("failed authentication")));
  EXPECT_THROW(seal.openChangeLog(sealed, "com.korvo.Calendars", 7), std::runtime_error);
  for (size_t at : {size_t{20}, sealed.size() - 40, sealed.size() - 1}) {
    Bytes flipped = sealed;
    flipped[at] ^= 0x01;
    EXPECT_THROW(seal.openChangeLog(flipped, "com.korvo.Contacts", 7), std::runtime_error) << at;
  }
  EXPECT_THROW(seal.openChangeLog(Bytes(sealed.begin(), sealed.end() - 1), "com.korvo.Contacts", 7),
               std::runtime_error);
  EXPECT_THAT([&] { seal.openChangeLog(plain, "com.korvo.Contacts", 7); },
              testing::ThrowsMessage<std::runtime_error>(HasSubstr("not encrypted")));
  EXPECT_FALSE(vtc::clog::readEnvelope(plain));
  const AccountSeal other(SecretKey::random());
  EXPECT_THROW(other.openChangeLog(sealed, "com.korvo.Contacts", 7), std::runtime_error);
}

TEST(AccountSealTest, NamesSealAlikeAndOpenOnlyForTheirPurpose) {
  const AccountSeal seal(SecretKey::random());
  const std::string name = seal.sealText("Mac A", "client name");
  EXPECT_TRUE(name.starts_with("sealed:"));
  EXPECT_EQ(name, seal.sealText("Mac A", "client name"));  // stable across sessions
  EXPECT_NE(name, seal.sealText("Mac B", "client name"));
  EXPECT_EQ(seal.openText(name, "client name"), "Mac A");
  EXPECT_FALSE(seal.openText(name, "truth digest"));
  EXPECT_FALSE(seal.openText("sealed:!!not base64", "client name"));
  EXPECT_FALSE(seal.openText("Mac A", "client name"));

  const Bytes report{'<', 'p', '>'};
  const Bytes sealed = seal.seal(report, "report");
  EXPECT_NE(sealed, seal.seal(report, "report"));  // a fresh nonce each time
  EXPECT_EQ(seal.open(sealed, "report"), report);
  EXPECT_FALSE(seal.open(sealed, "client name"));
  EXPECT_FALSE(seal.open(Bytes(5), "report"));
}

}  // namespace
