// An encrypted account on the real share: two and three computers sync the
// peer benchmark's cards and a calendar, and then nothing of them is found
// anywhere on the share: not in its files (changelogs, reports, the
// server's property and lock databases, its logs), not in any dead
// property, not in the owner of a lock held. A wrong passphrase changes
// nothing; a changelog changed on the share is set aside and named; a
// computer that joins later converges.
#include <gmock/gmock.h>

#include <filesystem>
#include <fstream>
#include <iterator>

#include "VantorSyncManager/NubiloChangeLog.h"
#include "VantorSyncManager/NubiloRemoteSession.h"
#include "VantorSyncManager/PublicNames.h"
#include "common/Format.h"
#include "localshare/Computer.h"
#include "localshare/Corpus.h"
#include "localshare/Share.h"
#include "platform/dav/DavPaths.h"
#include "platform/plist/PlistCodec.h"
#include "platform/sealing/AccountSeal.h"
#include "platform/sealing/KeyRecord.h"
#include "support/TestHome.h"

using testing::HasSubstr;
using testing::Not;
using vtc::local::Computer;
using vtc::local::Share;

namespace {

constexpr const char* kPassphrase = "correct horse battery staple";
constexpr const char* kContacts = "com.korvo.Contacts";
constexpr int kCards = 60;

const std::string kVisit =
    "BEGIN:VCALENDAR\r\nVERSION:2.0\r\nPRODID:-//Example//EN\r\nBEGIN:VEVENT\r\n"
    "UID:visit-2026@clinic.example\r\nDTSTAMP:20260101T000000Z\r\n"
    "DTSTART:20260310T090000Z\r\nDTEND:20260310T100000Z\r\nSUMMARY:Dentist Rosalind\r\n"
    "LOCATION:Harbour Clinic\r\nEND:VEVENT\r\nEND:VCALENDAR\r\n";

// What must not appear anywhere on the share: the corpus's names, e-mail
// addresses, phone numbers, UIDs, file names and the computers' names.
const std::vector<std::string> kSecrets = {
    "Person Number", "Number;Person",  "person.1@example", "person-1", "+1 555 01", "555 01",
    "Long Street",   "Springfield",    "conference",       "Dentist",  "Rosalind",  "Harbour",
    "visit-2026",    "clinic.example", "dentist.ics",      "Mac A",    "Mac B",     "Mac C"};

std::string readAll(const std::filesystem::path& path) {
  std::ifstream in(path, std::ios::binary);
  return std::string(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
}

class EncryptedAccount : public ::testing::Test {
 protected:
  vtc::test::TestHome home;
  std::unique_ptr<Share> server = vtc::local::startShare(vtc::local::ShareKind::Apache);
  Share& share = *server;
  std::string url = share.url("/sync");
  Computer a{"Mac A"};
  Computer b{"Mac B"};

  void SetUp() override {
    join(a, kPassphrase, {"--encrypt"});
    join(b, kPassphrase);
  }
  void join(const Computer& c, const std::string& passphrase, std::vector<std::string> more = {}) {
    std::vector<std::string> args = c.passphraseArguments(passphrase);
    args.insert(args.end(), more.begin(), more.end());
    for (const std::string& s : share.setupArguments()) args.push_back(s);
    c.join(url, Share::kUser, Share::kPassword, args);
  }
  Computer::Result sync(const Computer& c, int status = 0) {
    Computer::Result r = c.run({"sync", "-v"});
    EXPECT_EQ(r.status, status) << c.name() << ": " << r.err << r.out;
    return r;
  }
  // A library session of the account with its key (when it has one), as a
  // computer's own.
  std::unique_ptr<NubiloRemoteSession> sealedSession(const std::string& computer) const {
    vtc::Dictionary config = share.configuration();
    config.set("sync_path", vtc::Value("/sync"));
    config.set("ClientName", vtc::Value(computer));
    auto session = NubiloRemoteSession::sessionWithUsername(Share::kUser, Share::kPassword, config);
    const std::string text = readAll(share.diskPath("/sync/AccountKey.plist"));
    if (text.empty()) return session;
    auto record = vtc::plist::parse(vtc::Bytes(text.begin(), text.end()));
    auto key = vtc::sealing::unwrapKey(record->dictionary(), kPassphrase);
    session->setAccountSeal(std::make_shared<const vtc::sealing::AccountSeal>(std::move(*key)));
    return session;
  }
  // Every property of every resource under path, as text.
  static void collectProperties(NubiloRemoteSession& session, const std::string& path,
                                std::string& out) {
    DavTransaction t = session._issuePropFindWithRetryAtPath(path, kDAVOneDepth, {}, true);
    ASSERT_TRUE(t.isSuccessful()) << path;
    for (const auto& [href, props] : t.result().dictionary()) {
      out += href + "\n" + vtc::textOf(props) + "\n";
      std::string child = vtc::davpath::fromHref(href);
      if (!child.ends_with("/")) continue;
      if (std::filesystem::path(child).parent_path() != std::filesystem::path(path).parent_path())
        collectProperties(session, child, out);
    }
  }
  // What the share holds, every byte: its files on disk (including the
  // server's property and lock databases and its logs), and every property
  // of every resource as PROPFIND gives it, while a computer holds locks.
  std::string everythingOnTheShare() {
    std::string all;
    auto session = sealedSession("Mac A");
    session->lockClients();
    session->lockDataclass(kContacts);
    const std::filesystem::path root = std::filesystem::path(share.documentRoot()).parent_path();
    for (const auto& entry : std::filesystem::recursive_directory_iterator(root)) {
      if (!entry.is_regular_file()) continue;
      const std::string bytes = readAll(entry.path());
      all += entry.path().string() + "\n" + bytes;
      // A changelog's records are deflated: they are searched as read.
      if (entry.path().string().find(".clog") != std::string::npos)
        all += NubiloChangeLog(vtc::Bytes(bytes.begin(), bytes.end())).description();
    }
    collectProperties(*session, "/sync/", all);
    session->unlockDataclass(kContacts);
    session->unlockClients();
    return all;
  }
};

TEST_F(EncryptedAccount, ThreeComputersConvergeAndTheShareHoldsNothingOfTheirData) {
  for (int i = 0; i < kCards; ++i)
    Computer::write(a.contacts() + "/person-" + std::to_string(i) + ".vcf",
                    vtc::local::peerCard(i, 0));
  Computer::write(a.calendars() + "/dentist.ics", kVisit);
  EXPECT_THAT(sync(a).out, HasSubstr("sent " + std::to_string(kCards) + " changes"));
  sync(b);
  Computer::write(b.contacts() + "/person-3.vcf", vtc::local::peerCard(3, 1));
  sync(b);
  sync(a);
  EXPECT_EQ(Computer::files(a.contacts()), Computer::files(b.contacts()));
  EXPECT_EQ(Computer::files(b.calendars()), Computer::files(a.calendars()));
  EXPECT_EQ(Computer::read(a.contacts() + "/person-3.vcf"), vtc::local::peerCard(3, 1));

  // A third computer joins later with the passphrase and converges.
  Computer c{"Mac C"};
  join(c, kPassphrase);
  sync(c);
  EXPECT_EQ(Computer::files(c.contacts()), Computer::files(a.contacts()));
  EXPECT_EQ(Computer::files(c.calendars()), Computer::files(a.calendars()));
  // Each computer's status names the others, their names opened here.
  EXPECT_THAT(c.run({"status"}).out, testing::AllOf(HasSubstr("Mac A"), HasSubstr("Mac B")));

  const std::string shared = everythingOnTheShare();
  EXPECT_THAT(shared, HasSubstr("BodyEncryption=xchacha20poly1305-ietf/1"));  // it was searched
  EXPECT_THAT(shared, HasSubstr("synclockinfo"));
  EXPECT_THAT(shared, HasSubstr("sealed:"));  // the computers' names, as the share keeps them
  for (const std::string& secret : kSecrets)
    EXPECT_EQ(shared.find(secret), std::string::npos) << secret << " is on the share";

  // The changelog tool shows the envelope and says what it cannot show.
  const std::string clog = share.diskPath("/sync/Schemas/com.korvo.Contacts/00001.clog");
  const std::string tool = VSM_CLOG_PROGRAM;
  FILE* out = ::popen((tool + " dump '" + clog + "'").c_str(), "r");
  std::string text;
  for (char buffer[512]; std::fgets(buffer, sizeof buffer, out);) text += buffer;
  ::pclose(out);
  EXPECT_THAT(text, HasSubstr("Num Records:0"));
  EXPECT_THAT(text, HasSubstr("encrypted (xchacha20poly1305-ietf/1)"));
}

TEST_F(EncryptedAccount, AWrongPassphraseChangesNothingAndAChangedOneOpensTheSameKey) {
  Computer::write(a.contacts() + "/person-1.vcf", vtc::local::peerCard(1, 0));
  sync(a);
  const auto clientsBefore = share.members("/sync/Clients");

  Computer d{"Mac D"};
  auto setupWith = [&](const std::string& passphrase) {
    std::vector<std::string> setup{"setup",
                                   url,
                                   "--user",
                                   Share::kUser,
                                   "--password-command",
                                   "echo " + std::string(Share::kPassword)};
    for (const std::string& s : d.passphraseArguments(passphrase)) setup.push_back(s);
    for (const std::string& s : share.setupArguments()) setup.push_back(s);
    return d.run(setup);
  };
  Computer::Result wrong = setupWith("wrong horse");
  EXPECT_NE(wrong.status, 0);
  EXPECT_THAT(wrong.err, HasSubstr("That passphrase does not open this account's key; nothing "
                                   "was changed."));
  EXPECT_EQ(share.members("/sync/Clients"), clientsBefore);
  EXPECT_THAT(d.run({"sync"}).err, HasSubstr("is not set up on this computer"));

  // A changes the passphrase: the key and the data stay, B (which keeps the
  // key) syncs on, and a computer that joins now needs the new passphrase.
  Computer::Result changed =
      a.run({"passphrase"}, std::string(kPassphrase) + "\nnew horse\nnew horse\n");
  EXPECT_EQ(changed.status, 0) << changed.err;
  Computer::write(a.contacts() + "/person-2.vcf", vtc::local::peerCard(2, 0));
  sync(a);
  sync(b);
  EXPECT_EQ(Computer::files(b.contacts()), Computer::files(a.contacts()));
  EXPECT_NE(setupWith(kPassphrase).status, 0);
  EXPECT_EQ(setupWith("new horse").status, 0);
}

TEST_F(EncryptedAccount, AChangelogChangedOnTheShareIsSetAsideAndNamedAndSyncingGoesOn) {
  Computer::write(a.contacts() + "/person-1.vcf", vtc::local::peerCard(1, 0));
  sync(a);
  sync(b);
  Computer::write(a.contacts() + "/person-1.vcf", vtc::local::peerCard(1, 1));
  sync(a);
  const std::string second = share.diskPath("/sync/Schemas/com.korvo.Contacts/00002.clog");
  std::string bytes = readAll(second);
  bytes[bytes.size() - 30] ^= 0x01;
  Computer::write(second, bytes);

  Computer::Result r = sync(b, 9);  // synced, with something left over
  EXPECT_THAT(r.err, HasSubstr("com.korvo.Contacts: set aside changelog 2 (from Mac A): it failed "
                               "authentication"));
  EXPECT_EQ(Computer::read(b.contacts() + "/person-1.vcf"), vtc::local::peerCard(1, 0));

  // The next changelog is taken in as usual.
  Computer::write(a.contacts() + "/person-2.vcf", vtc::local::peerCard(2, 0));
  sync(a);
  EXPECT_THAT(sync(b).err, Not(HasSubstr("set aside")));
  EXPECT_EQ(Computer::read(b.contacts() + "/person-2.vcf"), vtc::local::peerCard(2, 0));
}

// An account in the clear turned over to encryption by one of its
// computers; the other follows once it has the passphrase.
class AccountTurnedOver : public EncryptedAccount {
 protected:
  void SetUp() override {
    a.join(url, Share::kUser, Share::kPassword, share.setupArguments());
    b.join(url, Share::kUser, Share::kPassword, share.setupArguments());
  }
};

TEST_F(AccountTurnedOver, OneCompactionLeavesOnlyCiphertextAndTheOtherComputerFollows) {
  for (int i = 0; i < 20; ++i)
    Computer::write(a.contacts() + "/person-" + std::to_string(i) + ".vcf",
                    vtc::local::peerCard(i, 0));
  Computer::write(a.calendars() + "/dentist.ics", kVisit);
  sync(a);
  sync(b);
  Computer::write(b.contacts() + "/person-4.vcf", vtc::local::peerCard(4, 1));
  sync(b);

  // In the clear, the search finds all of it.
  const std::string before = everythingOnTheShare();
  for (const char* secret :
       {"Person Number", "person.1@example", "+1 555 01", "person-1", "Dentist", "Mac A", "Mac B"})
    EXPECT_NE(before.find(secret), std::string::npos) << secret;

  std::vector<std::string> encrypt{"encrypt"};
  for (const std::string& s : a.passphraseArguments(kPassphrase)) encrypt.push_back(s);
  Computer::Result turned = a.run(encrypt);
  ASSERT_EQ(turned.status, 0) << turned.err << turned.out;
  EXPECT_EQ(Computer::read(a.contacts() + "/person-4.vcf"), vtc::local::peerCard(4, 1));
  // The other computer stops, changing nothing, until it has the passphrase.
  EXPECT_THAT(sync(b, 3).err, HasSubstr("The account's data is encrypted now"));
  // Setup again, its folders kept.
  std::vector<std::string> again{"setup",
                                 url,
                                 "--user",
                                 Share::kUser,
                                 "--password-command",
                                 "cat '" + b.home() + "/.password'"};
  for (const std::string& s : b.passphraseArguments(kPassphrase)) again.push_back(s);
  for (const std::string& s : share.setupArguments()) again.push_back(s);
  Computer::Result joined = b.run(again);
  ASSERT_EQ(joined.status, 0) << joined.err;
  sync(b);
  Computer::write(b.contacts() + "/person-5.vcf", vtc::local::peerCard(5, 1));
  sync(b);
  sync(a);
  EXPECT_EQ(Computer::files(a.contacts()), Computer::files(b.contacts()));
  EXPECT_EQ(Computer::files(a.calendars()), Computer::files(b.calendars()));

  const std::string shared = everythingOnTheShare();
  for (const std::string& secret : kSecrets)
    EXPECT_EQ(shared.find(secret), std::string::npos) << secret << " is on the share";
}

}  // namespace
