// Hostile input, row by row: a changelog from another computer, an answer
// of the share, a push message and a configuration download that once cost
// gigabytes, hung a sync or crashed it. Each now ends within bounded time
// and memory (measured from the child process that read it) with a sentence
// that says what happened. The share is the real one; the hostile bytes
// are put on it, or given by the fault proxy in front of it.
#include <gmock/gmock.h>

#include <filesystem>
#include <sstream>

#include "VantorSyncManager/NubiloChangeLog.h"
#include "VantorSyncManager/NubiloDataAdditions.h"
#include "VantorSyncManager/PublicNames.h"
#include "VantorSyncManager/VTCPrefsCenter.h"
#include "client/run/SyncRun.h"
#include "common/Limits.h"
#include "common/SecretMemory.h"
#include "localshare/ApacheShare.h"
#include "localshare/Computer.h"
#include "platform/plist/PlistCodec.h"
#include "platform/prefs/PreferenceStore.h"
#include "platform/process/Command.h"
#include "support/FaultProxy.h"
#include "support/HostileServer.h"
#include "support/TestHome.h"

using testing::HasSubstr;
using vtc::Bytes;
using vtc::local::ApacheShare;
using vtc::local::Computer;
using vtc::test::HostileAnswer;

namespace {

constexpr const char* kContacts = "/sync/Schemas/com.korvo.Contacts";
// Sanitizers make programs several times larger and slower.
#if defined(__SANITIZE_ADDRESS__)
constexpr long kLarger = 4;
constexpr double kSlower = 10;
#else
constexpr long kLarger = 1;
constexpr double kSlower = 1;
#endif
// What a sync that is refused takes at most: the client is about 15 MB.
constexpr long kRefusalKilobytes = kLarger * (64 << 10);

std::string card(const std::string& uid) {
  return "BEGIN:VCARD\r\nVERSION:3.0\r\nUID:" + uid + "\r\nFN:" + uid + "\r\nEND:VCARD\r\n";
}

// A changelog of raw records (identifier, archive), as a faulty or hostile
// computer could write it.
Bytes changelogOf(const std::vector<std::pair<std::string, Bytes>>& records,
                  const std::string& header = "CreatorClientName=Mallory") {
  Bytes body;
  for (const auto& [identifier, archive] : records) {
    NubiloAppendString(body, identifier);
    NubiloAppendUInt32(body, 2);
    NubiloAppendUInt32(body, static_cast<uint32_t>(archive.size()));
    body.insert(body.end(), archive.begin(), archive.end());
  }
  Bytes out;
  NubiloAppendUInt32(out, 101);
  NubiloAppendUInt32(out, static_cast<uint32_t>(12 + 4 * records.size()));
  for (size_t i = 0; i <= records.size(); ++i) NubiloAppendUInt32(out, 0xFFFFFFFF);
  NubiloAppendString(out, header);
  NubiloAppendString(out, "HeaderEnd=$%__END__OF__HEADER%$");
  const Bytes zipped = *NubiloGzip(body);
  const uint32_t start = static_cast<uint32_t>(out.size());
  for (size_t i = 0; i < records.size(); ++i)
    for (int b = 0; b < 4; ++b) out[8 + 4 * i + b] = static_cast<uint8_t>(start >> (24 - 8 * b));
  out.insert(out.end(), zipped.begin(), zipped.end());
  return out;
}

// A binary property list: an array of count references to one string.
Bytes referenceBomb(uint32_t count) {
  Bytes p{'b', 'p', 'l', 'i', 's', 't', '0', '0', 0xAF, 0x12};
  for (int b = 3; b >= 0; --b) p.push_back(static_cast<uint8_t>(count >> (8 * b)));
  p.insert(p.end(), count, 0x01);
  const uint32_t stringAt = static_cast<uint32_t>(p.size());
  p.insert(p.end(), {0x51, 'x'});
  const uint32_t tableAt = static_cast<uint32_t>(p.size());
  for (uint32_t offset : {8u, stringAt})
    for (int b = 3; b >= 0; --b) p.push_back(static_cast<uint8_t>(offset >> (8 * b)));
  Bytes trailer(32, 0);
  trailer[6] = 4;   // offset width
  trailer[7] = 1;   // reference width
  trailer[15] = 2;  // objects
  for (int b = 0; b < 4; ++b) trailer[28 + b] = static_cast<uint8_t>(tableAt >> (24 - 8 * b));
  p.insert(p.end(), trailer.begin(), trailer.end());
  return p;
}

Bytes deepXml(size_t depth) {
  std::string xml = "<?xml version=\"1.0\"?><plist version=\"1.0\">";
  for (size_t i = 0; i < depth; ++i) xml += "<array>";
  for (size_t i = 0; i < depth; ++i) xml += "</array>";
  xml += "</plist>";
  return Bytes(xml.begin(), xml.end());
}

std::string textOf(const Bytes& b) {
  return std::string(b.begin(), b.end());
}

struct Verified {
  vtc::process::CommandResult result;
  double seconds = 0;
  long peakKilobytes = 0;
};

// nubilo-clog verify, measured by GNU time (a child forked from the test
// would count the test's own pages).
Verified verify(const std::string& file) {
  const std::string usage = file + ".usage";
  Verified v{vtc::process::run(
      {"/usr/bin/time", "-q", "-f", "%e %M", "-o", usage, VSM_CLOG_PROGRAM, "verify", file})};
  std::istringstream(Computer::read(usage)) >> v.seconds >> v.peakKilobytes;
  return v;
}

class HostileInput : public ::testing::Test {
 protected:
  vtc::test::TestHome home;
  ApacheShare share;
  vtc::test::FaultProxy proxy{share.port()};
  Computer a{"Mac A"};  // straight to the share
  Computer b{"Mac B"};  // through the proxy
  std::string temporary = b.home() + "/tmp";

  void SetUp() override {
    std::filesystem::create_directories(temporary);
    b.setEnvironment("TMPDIR", temporary);
    a.join("http://127.0.0.1:" + std::to_string(share.port()) + "/sync", ApacheShare::kUser,
           ApacheShare::kPassword);
    b.join("http://127.0.0.1:" + std::to_string(proxy.port()) + "/sync", ApacheShare::kUser,
           ApacheShare::kPassword);
    b.setPreference("sync_dav_timeout_seconds", vtc::Value(1));
    Computer::write(a.contacts() + "/ann.vcf", card("ann"));
    sync(a);
    sync(b);
    // A second changelog, for B to fetch.
    Computer::write(a.contacts() + "/bob.vcf", card("bob"));
    sync(a);
  }
  static void sync(const Computer& c) {
    const Computer::Result r = c.run({"sync"});
    ASSERT_EQ(r.status, 0) << c.name() << ": " << r.err;
  }
  std::string second() const { return share.diskPath(std::string(kContacts) + "/00002.clog"); }
  std::string logOfB() const {
    return Computer::read(b.home() + "/Library/Logs/Sync/nubilosync.log");
  }
  // Nothing of a refused download is left in B's temporary folder.
  bool nothingLeft() const { return std::filesystem::is_empty(temporary); }
};

TEST_F(HostileInput, ChangelogsThatInflateBeyondTheirSizeAreRefusedAtOnceInLittleMemory) {
  // One record: twenty million references to one object, deflated.
  const Bytes bomb = changelogOf({{"bomb", referenceBomb(20'000'000)}});
  EXPECT_NEAR(bomb.size(), 19.7e3, 1e3);
  // One record with a field of 64 MB.
  const Bytes wide = changelogOf(
      {{"wide",
        vtc::plist::toBinary(vtc::Value(vtc::Array{vtc::Value(vtc::Dictionary{
            {"action", "set"}, {"name", "notes"}, {"value", std::string(64 << 20, 'n')}})}))}});
  EXPECT_LT(wide.size(), 100'000u);
  // Each may inflate to 256 times its size before it is refused.
  for (const auto& [name, bytes, kilobytes] :
       {std::tuple("bomb", bomb, 20 << 10), std::tuple("wide", wide, 40 << 10)}) {
    SCOPED_TRACE(name);
    const std::string file = home.path() + "/" + name + ".clog";
    Computer::write(file, textOf(bytes));
    const Verified read = verify(file);
    EXPECT_EQ(read.result.status, 1);
    EXPECT_THAT(read.result.err, HasSubstr("(the limit max_changelog_inflate_ratio)"));
    EXPECT_LT(read.seconds, 0.5 * kSlower);
    EXPECT_LT(read.peakKilobytes, kLarger * kilobytes);
  }

  Computer::write(second(), textOf(bomb));
  const Computer::Result r = b.runMeasured({"sync"});
  EXPECT_EQ(r.status, 1);
  EXPECT_THAT(r.err, HasSubstr("Syncing com.korvo.Contacts stopped: the share sent more than this "
                               "computer accepts (4.8 MB, the limit max_changelog_inflate_ratio). "
                               "If the share is trusted, raise max_changelog_inflate_ratio in "
                               "~/Library/Preferences/com.korvo.VantorSync.plist and sync again."));
  EXPECT_LT(r.seconds, 10 * kSlower);
  EXPECT_LT(r.peakKilobytes, kRefusalKilobytes);
}

TEST_F(HostileInput, AQuarterOfAMillionSmallRecordsDecodeInTimeAndMemoryInProportion) {
  std::vector<SyncEngineChange> changes;
  for (int i = 0; i < 250'000; ++i)
    changes.emplace_back(
        2, "r" + std::to_string(i),
        vtc::Array{vtc::Value(vtc::Dictionary{
            {"action", "set"}, {"name", "n"}, {"value", "v" + std::to_string(i)}})});
  Bytes bytes;
  NubiloChangeLog(std::move(changes)).writeToData(bytes);
  const std::string file = home.path() + "/many.clog";
  Computer::write(file, textOf(bytes));
  const Verified read = verify(file);
  EXPECT_EQ(read.result.status, 0) << read.result.err;
  EXPECT_THAT(read.result.out, HasSubstr("250000 changes"));
  // A million decode in under 60 s and 500 MB: a quarter in a quarter.
  EXPECT_LT(read.seconds, 15 * kSlower);
  EXPECT_LT(read.peakKilobytes, kLarger * (125 << 10));
}

TEST_F(HostileInput, AGigabyteAnswerToAChangelogDownloadIsGivenUpAtTheCapWithNothingLeft) {
  const vtc::test::Match download{"GET", std::string(kContacts) + "/00002.clog", 0};
  const std::string zeros(1 << 20, '\0');
  // Announced as a gigabyte: refused at its first bytes.
  proxy.respond(download, HostileAnswer::with(200, "application/octet-stream", zeros, 1024));
  Computer::Result r = b.runMeasured({"sync"});
  EXPECT_EQ(r.status, 1);
  EXPECT_THAT(r.err, HasSubstr("Syncing com.korvo.Contacts stopped: the share sent more than this "
                               "computer accepts (256 MB, the limit max_changelog_megabytes). If "
                               "the share is trusted, raise max_changelog_megabytes in "));
  EXPECT_LT(r.seconds, 10 * kSlower);
  EXPECT_LT(r.peakKilobytes, kRefusalKilobytes);
  EXPECT_TRUE(nothingLeft());

  // Not announced: given up as it arrives, at a cap the user lowered.
  proxy.clear();
  proxy.respond(download, HostileAnswer::with(200, "application/octet-stream", zeros, 1024, false));
  b.setPreference(vtc::Limits::kChangelogKey, vtc::Value(8));
  r = b.runMeasured({"sync"});
  EXPECT_THAT(r.err, HasSubstr("(8 MB, the limit max_changelog_megabytes)"));
  EXPECT_LT(r.seconds, 10 * kSlower);
  EXPECT_LT(r.peakKilobytes, kRefusalKilobytes);
  EXPECT_TRUE(nothingLeft());
}

TEST_F(HostileInput, ListingsOfTwentyToFiveHundredMegabytesOfEmptyElementsAreRefused) {
  const std::string open =
      "<?xml version=\"1.0\"?><D:multistatus xmlns:D=\"DAV:\"><D:response><D:href>/sync/"
      "Schemas/</D:href>";
  for (uint64_t megabytes : {20, 100, 500}) {
    SCOPED_TRACE(std::to_string(megabytes) + " MB");
    proxy.clear();
    HostileAnswer listing = HostileAnswer::with(207, "application/xml", std::string(1 << 18, ' '),
                                                megabytes << 2, false);
    for (size_t i = 0; i < listing.body.size(); i += 4) listing.body.replace(i, 4, "<a/>");
    listing.head += open;
    proxy.respond({"PROPFIND", "/sync/Schemas", 0}, listing);
    const Computer::Result r = b.runMeasured({"sync"});
    EXPECT_NE(r.status, 0);
    EXPECT_THAT(r.err, HasSubstr("the share sent more than this computer accepts (262144 XML "
                                 "elements, the limit max_answer_megabytes)"));
    EXPECT_LT(r.seconds, 10 * kSlower);
    EXPECT_LT(r.peakKilobytes, 2 * kRefusalKilobytes);
  }
  // An answer that is no WebDAV says so.
  proxy.clear();
  proxy.respond({"PROPFIND", "/sync/Schemas", 0},
                HostileAnswer::with(200, "text/html", "<html><body>Welcome</body></html>"));
  EXPECT_THAT(b.run({"sync"}).err,
              HasSubstr("was not WebDAV: HTTP 200 where a 207 multistatus was expected"));
}

TEST_F(HostileInput, AServerThatAnswersAByteAtATimeIsGivenUpAtTheTimeOutAndTheNextSyncRuns) {
  // One byte every fifth of a second: neon's read time-out of a second
  // would never end it.
  HostileAnswer drip = HostileAnswer::with(200, "application/octet-stream", std::string(100, 'x'));
  drip.piece = 1;
  drip.pause = std::chrono::milliseconds(200);
  proxy.respond({"GET", std::string(kContacts) + "/00002.clog", 0}, drip);
  const Computer::Result r = b.runMeasured({"sync"});
  EXPECT_EQ(r.status, 1);
  EXPECT_THAT(r.err, HasSubstr("The server gave no complete answer within 1 seconds while syncing "
                               "com.korvo.Contacts (sync_dav_timeout_seconds); the next sync tries "
                               "again."));
  // The download and its one retry, a second each, and the rest of the run.
  EXPECT_LT(r.seconds, 6 * kSlower);
  EXPECT_TRUE(nothingLeft());
  // Nothing of the run is left holding the computer or the share.
  proxy.clear();
  const Computer::Result next = b.run({"sync"});
  EXPECT_EQ(next.status, 0) << next.err;
  EXPECT_TRUE(std::filesystem::exists(b.contacts() + "/bob.vcf"));
}

TEST_F(HostileInput, AHeaderOfTwentyMegabytesThatCannotBeReadLeavesALineInTheLogNotItsSize) {
  Bytes clog = changelogOf({}, std::string(20 << 20, 'h'));
  Computer::write(second(), textOf(clog));
  const size_t before = logOfB().size();
  const Computer::Result r = b.runMeasured({"sync"});
  EXPECT_EQ(r.status, 1);
  EXPECT_THAT(r.err, HasSubstr("The share's copy of com.korvo.Contacts is damaged"));
  EXPECT_LT(logOfB().size() - before, 64u << 10);
  EXPECT_LT(r.peakKilobytes, 2 * kRefusalKilobytes);
}

TEST_F(HostileInput, PropertyListsNestedThirtyFiveThousandDeepAreRefusedNotACrash) {
  // A record of another computer whose archive is such a list, beside a
  // good one: the one is passed over, the other read.
  const Bytes good = vtc::plist::toBinary(vtc::Value(vtc::Array{}));
  const Bytes clog = changelogOf({{"deep", deepXml(35'000)}, {"good", good}});
  EXPECT_LT(clog.size(), 5'000u);
  const std::string file = home.path() + "/deep.clog";
  Computer::write(file, textOf(clog));
  const Verified read = verify(file);
  EXPECT_EQ(read.result.status, 0) << read.result.err;
  EXPECT_THAT(read.result.out,
              HasSubstr("1 changes\nrecord 0 (deep) passed over: its archive is not a "
                        "property list that can be read within its size"));
  EXPECT_LT(read.seconds, kSlower);

  // A report on the share, as `status` reads every computer's.
  Computer::write(share.diskPath("/sync/Reports/00000000-0000-4000-8000-000000000000.plist"),
                  textOf(deepXml(35'000)));
  const Computer::Result status = b.run({"status"});
  EXPECT_EQ(status.status, 0) << status.err;
  EXPECT_THAT(status.out, HasSubstr("Computers of the account:"));
}

TEST_F(HostileInput, AGigabyteConfigurationIsGivenUpAtItsCapAndNothingUnsignedIsCached) {
  std::string document(1 << 20, 'c');
  vtc::test::HostileServer configurationServer([&](const vtc::test::HostileRequest&) {
    return HostileAnswer::with(200, "application/octet-stream", document, 1024, false);
  });
  const std::string preferences = b.home() + "/Library/Preferences/com.korvo.VantorSync.plist";
  vtc::Dictionary perUser = vtc::plist::readFile(preferences).value_or(vtc::Value()).dictionary();
  perUser.set("ConfigurationHost",
              vtc::Value("127.0.0.1:" + std::to_string(configurationServer.port())));
  ASSERT_TRUE(vtc::plist::writeFileAtomically(preferences, vtc::Value(perUser)));
  const std::string cache = b.home() + "/.cache/com.korvo.nubilo.configuration";

  Computer::Result r = b.runMeasured({"sync"});
  EXPECT_EQ(r.status, 0) << r.err;  // the sync goes on with the built-in configuration
  EXPECT_THAT(logOfB(), HasSubstr(" is larger than 1 MB (the limit max_configuration_kilobytes)"));
  EXPECT_LT(r.seconds, 10 * kSlower);
  EXPECT_LT(r.peakKilobytes, kRefusalKilobytes);
  EXPECT_FALSE(std::filesystem::exists(cache));

  document = "a small document with no signature";
  r = b.run({"sync"});
  EXPECT_EQ(r.status, 0) << r.err;
  EXPECT_FALSE(std::filesystem::exists(cache));
  EXPECT_EQ(configurationServer.requests().size(), 2u);  // asked again, not taken from a cache
}

TEST_F(HostileInput, EscapeSequencesFromTheShareReachTheTerminalEscaped) {
  // Every computer's report, rewritten by a hostile one: control sequences
  // that clear the screen and retitle the window, and bytes that are no UTF-8.
  const std::string hostile = "manual\x1b[2J\x1b]0;owned\x07\xff";
  for (const auto& entry : std::filesystem::directory_iterator(share.diskPath("/sync/Reports")))
    ASSERT_TRUE(vtc::plist::writeFileAtomically(
        entry.path(), vtc::Value(vtc::Dictionary{{"SyncStatus:syncType", hostile},
                                                 {"com.korvo.Contacts\x1b[31m:code", "0"}})));
  const Computer::Result status = b.run({"status"});
  EXPECT_EQ(status.status, 0) << status.err;
  EXPECT_THAT(status.out, HasSubstr("manual\\x1b[2J\\x1b]0;owned\\x07\\xff sync, "
                                    "com.korvo.Contacts\\x1b[31m ok"));
  EXPECT_EQ(status.out.find('\x1b'), std::string::npos);
  const Computer::Result json = b.run({"status", "--json"});
  EXPECT_EQ(json.status, 0) << json.err;
  EXPECT_THAT(json.out, HasSubstr("\\u001b[2J"));
}

// In this process, as computer B: from the start of a sync to its end the
// process holds the password, and no core file may take it.
TEST_F(HostileInput, DuringASyncTheProcessCannotBeDumped) {
  struct Watch : vtc::client::Progress {
    std::vector<bool> dumpable;
    void step(const std::string&, const char*, size_t, size_t, int64_t) override {
      dumpable.push_back(vtc::processIsDumpable());
    }
    void done(const std::string&) override { dumpable.push_back(vtc::processIsDumpable()); }
  } watch;
  auto becomeHome = [](const std::string& path, const std::string& machineId) {
    ::setenv("HOME", path.c_str(), 1);
    machineId.empty() ? ::unsetenv("NUBILO_MACHINE_ID_FILE")
                      : ::setenv("NUBILO_MACHINE_ID_FILE", machineId.c_str(), 1);
    vtc::prefs::PreferenceStore::shared().resetForTesting();
    VTCPrefsCenter::defaultCenter().resetConfigurationForTesting();
  };
  ASSERT_TRUE(vtc::processIsDumpable());
  becomeHome(b.home(), b.home() + "/.machine-id");
  vtc::client::RunRequest request;
  request.progress = &watch;
  const vtc::client::RunResult result = vtc::client::runSync(request);
  becomeHome(home.path(), "");
  EXPECT_EQ(result.exitStatus(), 0);
  EXPECT_THAT(watch.dumpable,
              testing::AllOf(testing::Not(testing::IsEmpty()), testing::Each(false)));
  EXPECT_TRUE(vtc::processIsDumpable());
}

#if !defined(__SANITIZE_ADDRESS__)  // the sanitizer reserves more address space than any limit
TEST_F(HostileInput, MemoryThisComputerCannotGiveIsASentenceNotAnExceptionName) {
  std::vector<SyncEngineChange> changes;
  for (int i = 0; i < 300'000; ++i)
    changes.emplace_back(
        2, "r" + std::to_string(i),
        vtc::Array{vtc::Value(vtc::Dictionary{
            {"action", "set"}, {"name", "n"}, {"value", "v" + std::to_string(i)}})});
  Bytes bytes;
  NubiloChangeLog(std::move(changes)).writeToData(bytes);
  Computer::write(second(), textOf(bytes));
  // Enough to start and ask the share; not for the 150 MB these changes take.
  b.setAddressSpaceLimit(128 << 20);
  const Computer::Result r = b.run({"sync"});
  EXPECT_EQ(r.status, 1);
  EXPECT_THAT(r.err, HasSubstr("Syncing com.korvo.Contacts needed more memory than this computer "
                               "could give; the other folders were synced, and the next sync "
                               "tries again."));
  EXPECT_THAT(r.err, testing::Not(HasSubstr("bad_alloc")));
}
#endif

}  // namespace
