// No edit is ever lost silently and nothing another computer sends stops a
// dataclass: a computer joining with old copies, deletes against edits in
// either order, a record no computer can write, the delete guard on small
// folders and deletes confirmed elsewhere. Computers are homes of their own
// running the real client against a real Apache share.
#include <gmock/gmock.h>

#include <fcntl.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <unistd.h>

#include <filesystem>
#include <sstream>

#include "VantorSyncManager/NubiloDataAdditions.h"
#include "VantorSyncManager/NubiloRemoteSession.h"
#include "client/items/ItemRecord.h"
#include "client/merge/RecordMerge.h"
#include "localshare/ApacheShare.h"
#include "localshare/Computer.h"
#include "platform/plist/PlistCodec.h"
#include "support/TestHome.h"

using testing::HasSubstr;
using testing::Not;
using vtc::local::ApacheShare;
using vtc::local::Computer;

namespace {

std::string card(const std::string& uid, const std::string& fn, const std::string& tel) {
  return "BEGIN:VCARD\r\nVERSION:3.0\r\nUID:" + uid + "\r\nFN:" + fn + "\r\nTEL:" + tel +
         "\r\nEND:VCARD\r\n";
}

class NeverLose : public ::testing::Test {
 protected:
  vtc::test::TestHome home;
  ApacheShare share;
  std::string url = "http://127.0.0.1:" + std::to_string(share.port()) + "/sync";
  Computer a{"Mac A"};
  Computer b{"Mac B"};

  void SetUp() override {
    a.join(url, ApacheShare::kUser, ApacheShare::kPassword);
    b.join(url, ApacheShare::kUser, ApacheShare::kPassword);
  }
  Computer::Result sync(const Computer& c, std::vector<std::string> more = {}) {
    std::vector<std::string> args{"sync", "-v"};
    args.insert(args.end(), more.begin(), more.end());
    Computer::Result r = c.run(args);
    EXPECT_EQ(r.status, 0) << c.name() << ": " << r.err << r.out;
    return r;
  }
  static std::map<std::string, std::string> contactsOf(const Computer& c) {
    return Computer::files(c.contacts());
  }
  // The id of the kept conflict whose listing mentions `text`.
  static std::string conflictId(const Computer& c, const std::string& text) {
    std::istringstream lines(c.run({"conflicts"}).out);
    std::string id;
    for (std::string line; std::getline(lines, line);) {
      if (!line.starts_with(" ")) id = line.substr(0, 8);
      if (line.find(text) != std::string::npos) return id;
    }
    return "(no conflict mentions " + text + ")";
  }
  // A changelog committed by a faulty computer, straight through the library.
  void commitAsAnotherComputer(const std::vector<SyncEngineChange>& changes) {
    vtc::Dictionary config = share.configuration();
    config.set("sync_path", vtc::Value("/sync"));
    config.set("guid", vtc::Value("FAULTY-0000"));
    config.set("ClientName", vtc::Value("Faulty Phone"));
    auto session = NubiloRemoteSession::sessionWithUsername(ApacheShare::kUser,
                                                            ApacheShare::kPassword, config);
    const vtc::Dictionary record = session->getDataclassInfo("com.korvo.Contacts");
    const int64_t next = record.get("maxversion").integer() + 1;
    ASSERT_TRUE(session->commitChanges(changes, "com.korvo.Contacts", next, false));
  }
};

// The sets that add the item in `bytes` as record `id`.
SyncEngineChange addOf(const std::string& id, const std::string& file, const std::string& bytes) {
  auto record = vtc::client::recordOfBytes(vtc::client::ItemKind::Contacts, bytes, file);
  EXPECT_TRUE(record);
  return SyncEngineChange(SyncEngineChange::kAdd, id,
                          vtc::client::merge::recordSets(record.value_or(vtc::Dictionary{})));
}

TEST_F(NeverLose, AComputerJoiningWithOldCopiesKeepsTheAccountsNewerValuesAndItsOwnAsConflicts) {
  Computer::write(a.contacts() + "/ann.vcf", card("ann", "Ann", "1"));
  Computer::write(a.contacts() + "/bob.vcf", card("bob", "Bob", "2"));
  sync(a);
  Computer::write(a.contacts() + "/ann.vcf", card("ann", "Ann Smith", "11"));
  sync(a);
  // B had the address book from before, and a card of its own.
  Computer::write(b.contacts() + "/ann.vcf", card("ann", "Ann", "1"));
  Computer::write(b.contacts() + "/bob.vcf", card("bob", "Bob", "2"));
  Computer::write(b.contacts() + "/cat.vcf", card("cat", "Cat", "3"));
  Computer::Result joined = sync(b);
  EXPECT_THAT(joined.out, HasSubstr("(slow sync)"));
  EXPECT_THAT(joined.out, HasSubstr("kept 2 conflicts"));
  sync(a);
  EXPECT_EQ(contactsOf(a)["ann.vcf"], card("ann", "Ann Smith", "11"));
  EXPECT_EQ(contactsOf(a), contactsOf(b));
  EXPECT_EQ(contactsOf(a).size(), 3u);
  const std::string conflicts = b.run({"conflicts"}).out;
  EXPECT_THAT(conflicts, testing::ContainsRegex(
                             "\\| lost \\(from Mac B, [^\n]*\n +FN:Ann Smith +\\| FN:Ann\n"));
  EXPECT_THAT(conflicts,
              testing::ContainsRegex("\\| lost \\(from Mac B, [^\n]*\n +TEL:11 +\\| TEL:1\n"));
  EXPECT_THAT(a.run({"conflicts"}).out, HasSubstr("No conflicts"));
}

TEST_F(NeverLose, AnEditBeatsADeleteInEitherOrderAndTheDeleterIsToldAndCanDeleteAgain) {
  Computer::write(a.contacts() + "/x.vcf", card("x", "X", "1"));
  Computer::write(a.contacts() + "/y.vcf", card("y", "Y", "1"));
  Computer::write(a.contacts() + "/z.vcf", card("z", "Z", "1"));
  sync(a);
  sync(b);
  // x: the edit reaches the share first. y: the delete does.
  Computer::write(b.contacts() + "/x.vcf", card("x", "X", "2"));
  std::filesystem::remove(a.contacts() + "/y.vcf");
  sync(a);
  sync(b);
  std::filesystem::remove(a.contacts() + "/x.vcf");
  Computer::write(b.contacts() + "/y.vcf", card("y", "Y", "2"));
  Computer::Result bSaw = sync(b);
  Computer::Result aSaw = sync(a);
  EXPECT_THAT(aSaw.out, HasSubstr("2 deletes undone by edits elsewhere"));
  sync(b);
  for (const Computer* c : {&a, &b}) {
    EXPECT_EQ(contactsOf(*c)["x.vcf"], card("x", "X", "2")) << c->name();
    EXPECT_EQ(contactsOf(*c)["y.vcf"], card("y", "Y", "2")) << c->name();
  }
  const std::string listed = a.run({"conflicts"}).out;
  EXPECT_THAT(listed, HasSubstr("X: the item  (x.vcf, com.korvo.Contacts)"));
  EXPECT_THAT(listed, HasSubstr("Y: the item  (y.vcf, com.korvo.Contacts)"));
  EXPECT_THAT(listed, HasSubstr("deleted here, and kept because Mac B edited it"));
  // A deletes x again from the conflict, and the delete travels.
  Computer::Result again = a.run({"conflicts", "restore", conflictId(a, "x.vcf")});
  EXPECT_EQ(again.status, 0) << again.err;
  EXPECT_FALSE(std::filesystem::exists(a.contacts() + "/x.vcf"));
  sync(a);
  sync(b);
  EXPECT_EQ(contactsOf(b).count("x.vcf"), 0u);
  EXPECT_EQ(contactsOf(a), contactsOf(b));

  // A value that lost on B, of a card since deleted everywhere, comes back
  // with the card when B restores it.
  Computer::write(a.contacts() + "/z.vcf", card("z", "Z from A", "1"));
  Computer::write(b.contacts() + "/z.vcf", card("z", "Z from B", "1"));
  sync(a);
  sync(b);
  std::filesystem::remove(a.contacts() + "/z.vcf");
  sync(a);
  sync(b);
  ASSERT_EQ(contactsOf(b).count("z.vcf"), 0u);
  Computer::Result restored = b.run({"conflicts", "restore", conflictId(b, "Z from B")});
  EXPECT_EQ(restored.status, 0) << restored.err;
  sync(b);
  sync(a);
  EXPECT_EQ(contactsOf(a)["z.vcf"], card("z", "Z from B", "1"));
  EXPECT_EQ(contactsOf(a), contactsOf(b));
}

TEST_F(NeverLose, ARecordNoComputerCanWriteIsSetAsideAndNamedAndTheRestGoesOn) {
  Computer::write(a.contacts() + "/ann.vcf", card("ann", "Ann", "1"));
  sync(a);
  sync(b);
  // A faulty computer sends a card whose field is no content line, with a good one.
  vtc::Dictionary evil{{"(file)", "evil.vcf"},
                       {"(order)", "(begin)\nFN\n(end)"},
                       {"(begin)", "BEGIN:VCARD\r\n"},
                       {"FN", "this is no content line\r\n"},
                       {"(end)", "END:VCARD\r\n"}};
  commitAsAnotherComputer(
      {SyncEngineChange(SyncEngineChange::kAdd, "evil", vtc::client::merge::recordSets(evil)),
       addOf("good", "good.vcf", card("good", "Good", "5"))});
  for (const Computer* c : {&a, &b}) {
    Computer::Result r = c->run({"sync"});
    EXPECT_EQ(r.status, 9) << r.err;
    EXPECT_THAT(r.err,
                HasSubstr("set aside evil.vcf (from Faulty Phone): line 2 is not a content line"));
    EXPECT_EQ(contactsOf(*c).count("good.vcf"), 1u);
    EXPECT_EQ(contactsOf(*c).count("evil.vcf"), 0u);
    EXPECT_THAT(c->run({"status"}).out, HasSubstr("set aside evil.vcf (from Faulty Phone)"));
  }
  // The rest goes on: edits travel, a new computer joins.
  Computer::write(a.contacts() + "/ann.vcf", card("ann", "Ann", "100"));
  EXPECT_EQ(a.run({"sync"}).status, 9);
  EXPECT_EQ(b.run({"sync"}).status, 9);
  EXPECT_EQ(contactsOf(b)["ann.vcf"], card("ann", "Ann", "100"));
  Computer c{"Mac C"};
  c.join(url, ApacheShare::kUser, ApacheShare::kPassword);
  EXPECT_EQ(c.run({"sync"}).status, 9);
  EXPECT_EQ(contactsOf(c), contactsOf(a));
  // A repair writes the whole truth without it.
  EXPECT_EQ(a.run({"repair", "com.korvo.Contacts"}).status, 9);
  Computer d{"Mac D"};
  d.join(url, ApacheShare::kUser, ApacheShare::kPassword);
  EXPECT_EQ(d.run({"sync"}).status, 0);
  // Once the faulty computer sends it right, it is written where it is still set aside.
  commitAsAnotherComputer({addOf("evil", "evil.vcf", card("evil", "Not evil", "6"))});
  Computer::Result fixed = b.run({"sync"});
  EXPECT_EQ(fixed.status, 0) << fixed.err;
  EXPECT_EQ(contactsOf(b)["evil.vcf"], card("evil", "Not evil", "6"));
  EXPECT_THAT(b.run({"status"}).out, Not(HasSubstr("set aside")));
}

// A compaction writes the whole truth again; a computer that held that
// truth already goes on from it, and only one that did not reads it whole.
TEST_F(NeverLose, AComputerUpToDateAtACompactionGoesOnWithoutReadingTheWholeTruth) {
  for (int i = 0; i < 3; ++i)
    Computer::write(a.contacts() + "/p" + std::to_string(i) + ".vcf",
                    card("p" + std::to_string(i), "P", std::to_string(i)));
  sync(a);
  sync(b);
  Computer c{"Mac C"};
  c.join(url, ApacheShare::kUser, ApacheShare::kPassword);
  sync(c);
  Computer::write(c.contacts() + "/p0.vcf", card("p0", "P", "from C"));  // not sent yet
  a.setPreference("compaction_max_changelogs", vtc::Value(2));
  bool compacted = false;
  for (int round = 0; round < 3; ++round) {
    Computer::write(a.contacts() + "/p1.vcf", card("p1", "P", std::to_string(100 + round)));
    compacted = sync(a).out.find("history compacted") != std::string::npos || compacted;
    if (round < 2) sync(b);  // B keeps up until the last round
  }
  ASSERT_TRUE(compacted);
  Computer::Result resumed = sync(b);
  EXPECT_THAT(resumed.out, Not(HasSubstr("slow sync")));
  EXPECT_EQ(contactsOf(b), contactsOf(a));
  // C was behind: it reads the truth, and its edit still goes out.
  EXPECT_THAT(sync(c).out, HasSubstr("(slow sync)"));
  sync(a);
  sync(b);
  EXPECT_EQ(contactsOf(a)["p0.vcf"], card("p0", "P", "from C"));
  EXPECT_EQ(contactsOf(a), contactsOf(b));
  EXPECT_EQ(contactsOf(a), contactsOf(c));
}

// A change whose archive cannot be read is refused by itself: the other
// changes of its changelog arrive, the record is named, and edits of it made
// here still go out.
TEST_F(NeverLose, AChangeThatCannotBeReadIsRefusedByItselfAndItsRecordSetAside) {
  Computer::write(a.contacts() + "/ann.vcf", card("ann", "Ann", "1"));
  sync(a);
  sync(b);
  commitAsAnotherComputer({addOf("bea", "bea.vcf", card("bea", "Bea", "2"))});
  // The faulty computer's changelog, made by hand: a change of Ann whose
  // archive is garbage, then Bea's card again.
  auto put = [](vtc::Bytes& body, const std::string& id, uint32_t type, const vtc::Bytes& archive) {
    NubiloAppendString(body, id);
    NubiloAppendUInt32(body, type);
    NubiloAppendUInt32(body, static_cast<uint32_t>(archive.size()));
    body.insert(body.end(), archive.begin(), archive.end());
  };
  vtc::Bytes body;
  put(body, "ann", SyncEngineChange::kModify,
      vtc::Bytes{'b', 'p', 'l', 'i', 's', 't', '0', '0', 7});
  put(body, "bea", SyncEngineChange::kAdd,
      vtc::plist::toBinary(vtc::Value(addOf("bea", "bea.vcf", card("bea", "Bea", "3")).changes())));
  vtc::Bytes file;
  NubiloAppendUInt32(file, 101);
  NubiloAppendUInt32(file, 12 + 4 * 2);
  for (int i = 0; i <= 2; ++i) NubiloAppendUInt32(file, 0xFFFFFFFF);
  NubiloAppendString(file, "CreatorClientName=Faulty Phone");
  NubiloAppendString(file, "HeaderEnd=$%__END__OF__HEADER%$");
  const auto bodyStart = static_cast<uint32_t>(file.size());
  for (int i = 0; i < 4; ++i) file[8 + i] = static_cast<uint8_t>(bodyStart >> (24 - 8 * i));
  const vtc::Bytes zipped = *NubiloGzip(body);
  file.insert(file.end(), zipped.begin(), zipped.end());
  Computer::write(share.diskPath("/sync/Schemas/com.korvo.Contacts/00003.clog"),
                  std::string(file.begin(), file.end()));
  vtc::Dictionary config = share.configuration();
  config.set("sync_path", vtc::Value("/sync"));
  NubiloRemoteSession::sessionWithUsername(ApacheShare::kUser, ApacheShare::kPassword, config)
      ->setInfoForDataclass(vtc::Dictionary{{"maxversion", "00003"}}, "com.korvo.Contacts");

  Computer::Result r = b.run({"sync"});
  EXPECT_EQ(r.status, 9) << r.err;
  EXPECT_THAT(r.err,
              HasSubstr("set aside ann.vcf (from Faulty Phone): its change could not be read"));
  EXPECT_EQ(contactsOf(b)["bea.vcf"], card("bea", "Bea", "3"));
  // B's own edit of Ann still goes out, and a later change clears it.
  Computer::write(b.contacts() + "/ann.vcf", card("ann", "Ann", "from B"));
  EXPECT_EQ(b.run({"sync"}).status, 9);
  EXPECT_EQ(a.run({"sync"}).status, 0);  // the later change came with it
  EXPECT_EQ(contactsOf(a)["ann.vcf"], card("ann", "Ann", "from B"));
  Computer::write(a.contacts() + "/ann.vcf", card("ann", "Ann", "from A"));
  sync(a);
  EXPECT_EQ(b.run({"sync"}).status, 0);
  EXPECT_EQ(contactsOf(b), contactsOf(a));
}

TEST_F(NeverLose,
       EmptyingAFolderOfAnySizeIsRefusedAndADeleteConfirmedOnOneComputerTravelsAsConfirmed) {
  Computer::write(a.contacts() + "/one.vcf", card("one", "One", "1"));
  Computer::write(a.contacts() + "/two.vcf", card("two", "Two", "2"));
  sync(a);
  sync(b);
  std::filesystem::remove(a.contacts() + "/one.vcf");
  std::filesystem::remove(a.contacts() + "/two.vcf");
  Computer::Result refused = a.run({"sync"});
  EXPECT_EQ(refused.status, 6);
  EXPECT_THAT(refused.err, HasSubstr("is empty but held 2 items"));
  EXPECT_EQ(contactsOf(b).size(), 2u);
  sync(a, {"--max-delete", "100"});
  Computer::Result applied = sync(b);
  EXPECT_THAT(applied.out, HasSubstr("2 deletes confirmed on another computer"));
  EXPECT_TRUE(contactsOf(b).empty());
}

// Makes a folder immutable, or mutable again: the one way to make a folder
// that cannot be written when the tests run as root.
bool setImmutable(const std::string& folder, bool on) {
  int fd = ::open(folder.c_str(), O_RDONLY | O_DIRECTORY);
  if (fd < 0) return false;
  int flags = 0;
  bool ok = ::ioctl(fd, FS_IOC_GETFLAGS, &flags) == 0;
  flags = on ? (flags | FS_IMMUTABLE_FL) : (flags & ~FS_IMMUTABLE_FL);
  ok = ok && ::ioctl(fd, FS_IOC_SETFLAGS, &flags) == 0;
  ::close(fd);
  return ok;
}

TEST_F(NeverLose, AFolderThatCannotBeWrittenFailsTheSyncNamesTheFileAndIsWrittenNextTime) {
  Computer::write(a.contacts() + "/ann.vcf", card("ann", "Ann", "1"));
  sync(a);
  sync(b);
  Computer::write(a.contacts() + "/bob.vcf", card("bob", "Bob", "2"));
  sync(a);
  if (!setImmutable(b.contacts(), true)) GTEST_SKIP() << "this file system cannot lock a folder";
  Computer::Result failed = b.run({"sync"});
  setImmutable(b.contacts(), false);
  EXPECT_EQ(failed.status, 9) << failed.out << failed.err;
  EXPECT_THAT(failed.err, HasSubstr("could not write bob.vcf"));
  EXPECT_THAT(b.run({"status"}).out, HasSubstr("not written bob.vcf"));

  sync(b);
  EXPECT_EQ(contactsOf(b), contactsOf(a));
  EXPECT_THAT(b.run({"status"}).out, Not(HasSubstr("not written")));
}

}  // namespace
