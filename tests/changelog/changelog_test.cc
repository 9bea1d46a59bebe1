// Changelogs written and read back byte for byte, damaged ones refused,
// mapped ones decoded lazily, and the crash flags that guard decoding.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/resource.h>

#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <random>
#include <sstream>
#include <stdexcept>

#include "VantorSyncManager/NubiloChangeLog.h"
#include "VantorSyncManager/NubiloDataAdditions.h"
#include "VantorSyncManager/NubiloException.h"
#include "VantorSyncManager/PublicNames.h"
#include "changelog/ChangeLogFormat.h"
#include "common/Logging.h"
#include "platform/engine/SyncEngine.h"
#include "platform/plist/PlistCodec.h"
#include "platform/prefs/PreferenceStore.h"
#include "support/LogCapture.h"
#include "support/TestHome.h"

using testing::HasSubstr;
using testing::StartsWith;
using testing::ThrowsMessage;
using vtc::Array;
using vtc::Bytes;
using vtc::Dictionary;
using vtc::Value;

namespace {

// Throws a NubiloException of this name.
auto ThrowsNamed(const char* name) {
  return testing::Throws<NubiloException>(
      testing::Property(&NubiloException::name, testing::StrEq(name)));
}

Dictionary setting(const std::string& name, Value value) {
  return Dictionary{{"action", "set"}, {"name", name}, {"value", std::move(value)}};
}

std::vector<SyncEngineChange> sampleChanges() {
  auto date = vtc::Date(std::chrono::seconds(1300000000) + std::chrono::microseconds(500));
  return {
      SyncEngineChange(1, "contact-1",
                       Array{Value(setting("first", "Ann\xC3\xA9")), Value(setting("age", 42)),
                             Value(setting("score", 2.5)), Value(setting("vip", true)),
                             Value(setting("born", date)), Value(setting("photo", Bytes{0, 255})),
                             Value(setting("phones", Array{Value("1"), Value("2")})),
                             Value(setting("address", Dictionary{{"city", "Oslo"}}))}),
      SyncEngineChange(2, "contact-2",
                       Array{Value(Dictionary{{"action", "clear"}, {"name", "age"}})}),
      SyncEngineChange(3, "contact-3", Array{}),
  };
}

Bytes written(NubiloChangeLog& log) {
  Bytes out;
  log.writeToData(out);
  return out;
}

// A changelog file around an uncompressed body of count records.
Bytes changelogWithBody(uint32_t count, const Bytes& body) {
  Bytes file;
  NubiloAppendUInt32(file, 101);
  NubiloAppendUInt32(file, 12 + 4 * count);
  for (uint32_t i = 0; i <= count; ++i) NubiloAppendUInt32(file, 0xFFFFFFFF);
  NubiloAppendString(file, "Origin=test");
  NubiloAppendString(file, "HeaderEnd=$%__END__OF__HEADER%$");
  const auto bodyStart = static_cast<uint32_t>(file.size());
  for (int i = 0; i < 4; ++i) file[8 + i] = static_cast<uint8_t>(bodyStart >> (24 - 8 * i));
  Bytes zipped = *NubiloGzip(body);
  file.insert(file.end(), zipped.begin(), zipped.end());
  return file;
}

Bytes readFile(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  return Bytes((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
}

// The reason of the failure that decoding bytes raises, or "" when none.
std::string refusal(const Bytes& bytes) {
  try {
    NubiloChangeLog log(bytes);
  } catch (const NubiloException& e) {
    EXPECT_EQ(e.name(), NubiloCorruptChangelogException);
    return e.reason();
  }
  return "";
}

class ChangeLog : public ::testing::Test {
 protected:
  vtc::test::TestHome home;

  std::string logText() const {
    std::stringstream s;
    s << std::ifstream(vtc::log::logFilePath()).rdbuf();
    return s.str();
  }
};

TEST_F(ChangeLog, ChangesOfEveryValueKindRoundTripInOrder) {
  NubiloChangeLog log(sampleChanges());
  log.setHeaderValue(Value("GUID-1"), "CreatorClientGuid");
  log.setSchemaVersions(
      Array{Value(Dictionary{{"Name", "Contacts"}, {"MajorVersion", 3}, {"MinorVersion", 1}}),
            Value(Dictionary{{"Name", "Incomplete"}, {"MajorVersion", 1}})});
  Bytes bytes = written(log);
  NubiloChangeLog back(bytes);
  EXPECT_EQ(back.changes(), sampleChanges());
  EXPECT_EQ(back.version(), 101u);
  EXPECT_EQ(back.headerValueForKey("CreatorClientGuid").string(), "GUID-1");
  EXPECT_EQ(back.headerValueForKey("CreatorClientType").string(), "Vantor Client");
  EXPECT_EQ(back.headerValueForKey("Contacts.Version").string(), "3.1");
  EXPECT_EQ(
      *back.getSchemaVersions(),
      (Array{Value(Dictionary{{"Name", "Contacts"}, {"MajorVersion", 3}, {"MinorVersion", 1}})}));
  EXPECT_EQ(back.summary().substr(back.summary().size() - 6), "1\t1\t1\n");
}

TEST_F(ChangeLog, TheByteLayoutIsIndexHeadersTerminatorBody) {
  NubiloChangeLog log(std::vector<SyncEngineChange>{SyncEngineChange(1, "abc", Array{})});
  Bytes bytes = written(log);
  EXPECT_EQ(NubiloUInt32AtOffset(bytes, 0), 101u);
  EXPECT_EQ(NubiloUInt32AtOffset(bytes, 4), 16u);  // H = 12 + 4n
  const uint32_t bodyStart = NubiloUInt32AtOffset(bytes, 8);
  EXPECT_EQ(NubiloUInt32AtOffset(bytes, 12), 0xFFFFFFFFu);
  std::string headerEnd = "HeaderEnd=$%__END__OF__HEADER%$";
  std::string before(bytes.begin() + bodyStart - headerEnd.size() - 1, bytes.begin() + bodyStart);
  EXPECT_EQ(before, headerEnd + std::string(1, '\0'));

  Bytes archive = vtc::plist::toBinary(Value(Array{}));
  Bytes expectedBody = {'a', 'b', 'c', 0, 0, 0, 0, 1};
  NubiloAppendUInt32(expectedBody, static_cast<uint32_t>(archive.size()));
  expectedBody.insert(expectedBody.end(), archive.begin(), archive.end());
  EXPECT_EQ(NubiloCopyGunzip(vtc::ByteView(bytes).subspan(bodyStart)), expectedBody);
  EXPECT_EQ(Bytes(bytes.begin() + bodyStart, bytes.begin() + bodyStart + 10),
            (Bytes{0x1F, 0x8B, 0x08, 0, 0, 0, 0, 0, 0, 0x03}));
}

TEST_F(ChangeLog, EmptyAndChangeFreeChangelogs) {
  NubiloChangeLog none(std::vector<SyncEngineChange>{});
  Bytes bytes = written(none);
  EXPECT_EQ(NubiloUInt32AtOffset(bytes, 8), 0xFFFFFFFFu);
  NubiloChangeLog back(bytes);
  EXPECT_TRUE(back.changes().empty());
  EXPECT_FALSE(back.headerValueForKey("CreationTimestamp").isNone());

  NubiloChangeLog empty{vtc::ByteView()};
  EXPECT_TRUE(empty.changes().empty());
  EXPECT_TRUE(empty.headers().empty());
  EXPECT_FALSE(empty.getSchemaVersions());
}

TEST_F(ChangeLog, HeaderLinesAreCutAtASecondEqualsSign) {
  NubiloChangeLog log(std::vector<SyncEngineChange>{});
  log.setHeaderValue(Value("a=b"), "Odd");
  log.setHeaderValue(Value("1.2.3"), "Three.Version");
  log.setHeaderValue(Value("7"), "One.Version");
  NubiloChangeLog back(written(log));
  EXPECT_EQ(back.headerValueForKey("Odd").string(), "a");
  EXPECT_FALSE(back.getSchemaVersions());  // neither version has two pieces
}

TEST_F(ChangeLog, DamagedFilesAreRefusedAsCorrupt) {
  Bytes bytes = written(*std::make_unique<NubiloChangeLog>(sampleChanges()));
  const uint32_t bodyStart = NubiloUInt32AtOffset(bytes, 8);
  auto refused = [](Bytes b) {
    try {
      NubiloChangeLog log(b);
    } catch (const NubiloException& e) {
      return e.name() == NubiloCorruptChangelogException &&
             e.reason().rfind("Exception trying to decode changelog ", 0) == 0;
    }
    return false;
  };
  EXPECT_TRUE(refused(Bytes(bytes.begin(), bytes.begin() + 10)));             // inside the index
  EXPECT_TRUE(refused(Bytes(bytes.begin(), bytes.begin() + bodyStart - 5)));  // inside headers
  EXPECT_TRUE(refused(Bytes(bytes.begin(), bytes.end() - 20)));               // inside the body
  Bytes garbled = bytes;
  garbled[bodyStart + 10] = 0xFF;  // a deflate block of the reserved type
  EXPECT_TRUE(refused(garbled));
  Bytes noEquals = bytes;
  noEquals[NubiloUInt32AtOffset(bytes, 4) + 2] = '\0';  // a header line without "="
  EXPECT_TRUE(refused(noEquals));

  Bytes otherVersion = bytes;
  otherVersion[3] = 102;  // any format number is read
  EXPECT_EQ(NubiloChangeLog(otherVersion).version(), 102u);
}

// Inputs the fuzzer found: each once crashed the reader or ran it out of
// memory, and must now be refused as corrupt.
// Each was found by fuzzing; reading it once crashed or exhausted memory.
TEST_F(ChangeLog, InputsThatOnceBrokeTheReaderAreReadOrRefused) {
  size_t files = 0;
  for (const auto& entry :
       std::filesystem::directory_iterator(std::string(VSM_TEST_DATA) + "/changelog/data")) {
    ++files;
    try {
      auto log = NubiloChangeLog::changeLogWithContentsOfFile(entry.path());
      log->summary();
    } catch (const NubiloException& e) {
      EXPECT_EQ(e.name(), NubiloCorruptChangelogException) << entry.path();
    }
  }
  EXPECT_GE(files, 2u);
}

TEST_F(ChangeLog, LargeChangelogsAreMappedAndDecodedOnlyWhenLookedAt) {
  Bytes bytes = written(*std::make_unique<NubiloChangeLog>(sampleChanges()));
  auto small = NubiloChangeLog::createChangeLogWithData(bytes, bytes.size() + 1);
  EXPECT_EQ(dynamic_cast<NubiloMappedChangelog*>(small.get()), nullptr);
  auto large = NubiloChangeLog::createChangeLogWithData(bytes, bytes.size());
  auto* mapped = dynamic_cast<NubiloMappedChangelog*>(large.get());
  ASSERT_NE(mapped, nullptr);

  EXPECT_NE(mapped->description().find("Num Records:0"), std::string::npos);
  Bytes again;
  mapped->writeToData(again);
  EXPECT_EQ(again, bytes);  // as downloaded, timestamp included
  EXPECT_THAT(
      [&] { mapped->setHeaderValue(Value("x"), "Key"); },
      ThrowsMessage<std::invalid_argument>("Cannot setHeaderValue on a memory mapped Changelog"));
  EXPECT_THAT([&] { mapped->setSchemaVersions(Array{}); },
              ThrowsMessage<std::invalid_argument>(
                  "Cannot setSchemaVersions on a memory mapped Changelog"));

  EXPECT_EQ(mapped->changes(), sampleChanges());
  EXPECT_TRUE(mapped->isDecoded());
  EXPECT_NE(mapped->description().find("Num Records:3"), std::string::npos);
  Bytes fresh;
  mapped->writeToData(fresh);
  EXPECT_EQ(NubiloChangeLog(fresh).changes(), sampleChanges());
}

// The temporary file of a mapped changelog lives exactly as long as its bytes
// are held: gone after a decode, or with the changelog, but kept after a
// failed decode for the next try. Without a usable temporary folder the bytes
// stay in memory.
TEST_F(ChangeLog, MappedChangelogsLeaveNoTemporaryFileBehind) {
  const std::string tmp = home.path() + "/tmp";
  std::filesystem::create_directories(tmp);
  const char* previous = std::getenv("TMPDIR");
  const std::string saved = previous ? previous : "";
  ::setenv("TMPDIR", tmp.c_str(), 1);
  auto files = [&] {
    return std::distance(std::filesystem::directory_iterator(tmp),
                         std::filesystem::directory_iterator());
  };
  Bytes bytes = written(*std::make_unique<NubiloChangeLog>(sampleChanges()));

  auto decoded = NubiloChangeLog::createChangeLogWithData(bytes, 0);
  EXPECT_EQ(files(), 1);
  EXPECT_EQ(decoded->changes().size(), 3u);
  EXPECT_EQ(files(), 0);

  NubiloChangeLog::createChangeLogWithData(bytes, 0).reset();  // never looked at
  EXPECT_EQ(files(), 0);

  Bytes damaged(bytes.begin(), bytes.end() - 1);
  auto failing = NubiloChangeLog::createChangeLogWithData(damaged, 0);
  EXPECT_THAT([&] { failing->changes(); }, ThrowsNamed(NubiloCorruptChangelogException));
  EXPECT_EQ(files(), 1);  // kept for another try
  EXPECT_THAT([&] { failing->headers(); }, ThrowsNamed(NubiloCorruptChangelogException));
  EXPECT_TRUE(failing->description().find("Num Records:0") != std::string::npos);
  failing.reset();
  EXPECT_EQ(files(), 0);

  auto& store = vtc::prefs::PreferenceStore::shared();
  store.setValue("LoggingLevel", Value("warn"), "com.korvo.VantorSync", vtc::prefs::Scope::AnyHost);
  ASSERT_TRUE(store.synchronize("com.korvo.VantorSync", vtc::prefs::Scope::AnyHost));
  vtc::log::resetForTesting();
  const std::string notAFolder = home.path() + "/file";
  std::ofstream(notAFolder) << "x";
  ::setenv("TMPDIR", notAFolder.c_str(), 1);
  auto inMemory = NubiloChangeLog::createChangeLogWithData(bytes, 0);
  EXPECT_THAT(logText(), HasSubstr("|Warning|Failed to write temporary changelog data to " +
                                   notAFolder + "/"));
  EXPECT_THAT(logText(), HasSubstr(" for memory mapping, keeping data in memory instead\n"));
  Bytes again;
  inMemory->writeToData(again);
  EXPECT_EQ(again, bytes);
  EXPECT_EQ(inMemory->changes(), sampleChanges());

  if (previous)
    ::setenv("TMPDIR", saved.c_str(), 1);
  else
    ::unsetenv("TMPDIR");
}

TEST_F(ChangeLog, TheTextDumpHasTheSummaryHeadersAndEveryChange) {
  Bytes bytes = written(*std::make_unique<NubiloChangeLog>(sampleChanges()));
  NubiloChangeLog log(bytes);
  const std::string path = home.path() + "/dump.txt";
  auto dump = [&](NubiloChangeLog& from, bool summary) {
    from.dumpToTextFile(path, summary);
    return readFile(path);
  };
  const Bytes withSummary = dump(log, true);
  const std::string text(withSummary.begin(), withSummary.end());
  const std::string summary = log.summary();
  EXPECT_EQ(text.substr(0, summary.size()), summary);
  EXPECT_THAT(text, HasSubstr(summary + "Num Records:3\nChange log headers: \n"));
  EXPECT_THAT(text, HasSubstr("\nCreatorClientType=Vantor Client\n"));
  for (const SyncEngineChange& c : sampleChanges())
    EXPECT_THAT(text, HasSubstr("\n" + c.description() + "\n\n"));

  // A mapped changelog is decoded for its dump; without the summary the
  // dump starts at the record count.
  auto mapped = NubiloChangeLog::createChangeLogWithData(bytes, 0);
  const Bytes plain = dump(*mapped, false);
  EXPECT_EQ(std::string(plain.begin(), plain.end()), text.substr(summary.size()));
}

TEST_F(ChangeLog, CrashFlagsCountUnfinishedDecodesAndRefuseTheThird) {
  Bytes bytes = written(*std::make_unique<NubiloChangeLog>(sampleChanges()));
  std::string flag = vtc::clog::crashFlagPath(vtc::clog::stableHash(bytes));
  NubiloChangeLog{bytes};
  EXPECT_FALSE(std::filesystem::exists(flag));  // a finished decode leaves none

  std::filesystem::create_directories(std::filesystem::path(flag).parent_path());
  NubiloChangeLog probe;
  probe.setCrashFlagForHash(vtc::clog::stableHash(bytes));  // a decode that "crashed"
  EXPECT_EQ(std::filesystem::file_size(flag), 0u);
  probe.setCrashFlagForHash(vtc::clog::stableHash(bytes));  // and a second one
  EXPECT_EQ(std::filesystem::file_size(flag), 8u);
  EXPECT_THAT([&] { NubiloChangeLog{bytes}; },
              ThrowsNamed(NubiloCorruptChangelogException));  // the third is refused
  EXPECT_FALSE(std::filesystem::exists(flag));
  EXPECT_EQ(NubiloChangeLog{bytes}.changes().size(), 3u);  // and the count starts again
}

TEST_F(ChangeLog, ABodyCutShortByEvenOneByteIsRefused) {
  Bytes bytes = written(*std::make_unique<NubiloChangeLog>(sampleChanges()));
  for (size_t cut = 1; cut <= 4; ++cut)
    EXPECT_EQ(refusal(Bytes(bytes.begin(), bytes.end() - static_cast<std::ptrdiff_t>(cut))),
              "Exception trying to decode changelog Failed to unzip changes from clog, Headers:")
        << cut;
  // Bytes after the end of the deflate stream (a real gzip trailer) are no cut.
  Bytes trailed = bytes;
  trailed.insert(trailed.end(), 8, 0xAB);
  EXPECT_EQ(NubiloChangeLog(trailed).changes(), sampleChanges());
}

// One record whose archive is an array holding itself a million times: a
// file of about a kilobyte that once built gigabytes of values.
TEST_F(ChangeLog, ASelfReferencingArchiveIsRefusedAtOnceInLittleMemory) {
  Bytes bytes =
      readFile(std::string(VSM_TEST_DATA) + "/changelog/data/self-referencing-archive.clog");
  ASSERT_LT(bytes.size(), 4096u);
  rusage before{}, after{};
  getrusage(RUSAGE_SELF, &before);
  const auto start = std::chrono::steady_clock::now();
  EXPECT_THAT(refusal(bytes), StartsWith("Exception trying to decode changelog "));
  const auto took = std::chrono::steady_clock::now() - start;
  getrusage(RUSAGE_SELF, &after);
  EXPECT_LT(took, std::chrono::seconds(1));  // refused in milliseconds; it took seconds
  EXPECT_LT(after.ru_maxrss - before.ru_maxrss, 64 * 1024);  // KiB
}

TEST_F(ChangeLog, TruncatedRecordsAndBadIndexesAreRefusedWithTheirReason) {
  // A record header beyond the end reads as a bounds failure of the body.
  Bytes body = {'a', 'b', 'c', 0, 0, 0};
  EXPECT_EQ(refusal(changelogWithBody(1, body)),
            "Exception trying to decode changelog Attempting to parse value beyond bounds of "
            "changelog data length:6 offset:4, Headers:");
  NubiloAppendUInt32(body, 1);
  body.push_back(0);
  EXPECT_EQ(refusal(changelogWithBody(1, body)),
            "Exception trying to decode changelog Attempting to parse value beyond bounds of "
            "changelog data length:11 offset:8, Headers:");
  // A header offset inside the index would wrap the record count.
  Bytes file = written(*std::make_unique<NubiloChangeLog>(sampleChanges()));
  for (uint8_t offset : {0, 4, 8, 11}) {
    Bytes bad = file;
    bad[7] = offset;
    EXPECT_THAT(refusal(bad), HasSubstr("inside the index")) << int{offset};
  }
}

TEST_F(ChangeLog, ARecordWhoseArchiveCannotBeDecodedIsPassedOverAndTheOthersRead) {
  vtc::test::LogCapture logged;
  auto record = [](Bytes& body, const std::string& identifier, const Bytes& archive) {
    NubiloAppendString(body, identifier);
    NubiloAppendUInt32(body, 2);
    NubiloAppendUInt32(body, static_cast<uint32_t>(archive.size()));
    body.insert(body.end(), archive.begin(), archive.end());
  };
  const Array changes{Value(setting("first", "Ann"))};
  std::string deep = "<plist version=\"1.0\">";
  for (int i = 0; i < 200; ++i) deep += "<array>";
  for (int i = 0; i < 200; ++i) deep += "</array>";
  deep += "</plist>";
  Bytes body;
  record(body, "first", vtc::plist::toBinary(changes));
  record(body, "garbled", Bytes{'b', 'p', 'l', 'i', 's', 't', '0', '0', 1, 2, 3});
  record(body, "too deep", Bytes(deep.begin(), deep.end()));
  record(body, "no list", vtc::plist::toBinary(Value("text")));
  record(body, "last", vtc::plist::toBinary(changes));
  NubiloChangeLog log(changelogWithBody(5, body));
  ASSERT_EQ(log.changes().size(), 2u);
  EXPECT_EQ(log.changes()[1], SyncEngineChange(2, "last", changes));
  ASSERT_EQ(log.refusedChanges().size(), 3u);
  EXPECT_EQ(log.refusedChanges()[0].position, 1u);
  EXPECT_EQ(log.refusedChanges()[1].recordIdentifier, "too deep");
  EXPECT_EQ(log.refusedChanges()[1].reason,
            "its archive is not a property list that can be read within its size");
  EXPECT_EQ(log.refusedChanges()[2].reason, "its archive is not a list of changes");
  EXPECT_THAT(logged.messages("Warning"),
              testing::Contains("Record 3 (no list) of a changelog was passed over: its archive is "
                                "not a list of changes"));
  // The frame around the records is still whole or refused whole.
  body.resize(body.size() - 1);
  EXPECT_THAT(refusal(changelogWithBody(5, body)),
              HasSubstr("record archive beyond the end of changelog data"));
  EXPECT_TRUE(NubiloChangeLog(written(*std::make_unique<NubiloChangeLog>(sampleChanges())))
                  .refusedChanges()
                  .empty());
}

TEST_F(ChangeLog, TheErrorLineShowsOnlyTheHeadersReadFromTheseBytes) {
  EXPECT_THAT(refusal(Bytes{0, 0, 0}), StartsWith("Exception trying to decode changelog "));
  EXPECT_THAT(logText(),
              HasSubstr("|Error|Exception caught while trying to process changelog Attempting to "
                        "parse value beyond bounds of changelog data length:3 offset:0 \n "
                        "Headers:(null)\n"));
  // A changelog being written keeps its own headers out of a failed read's line.
  NubiloChangeLog log(sampleChanges());
  EXPECT_THAT(
      [&] {
        log.parseData(Bytes{0, 0, 0, 101, 0, 0});
      },
      ThrowsNamed(NubiloCorruptChangelogException));
  EXPECT_EQ(logText().find("CreatorClientType"), std::string::npos) << logText();
  EXPECT_EQ(log.headerValueForKey("CreatorClientType").string(), "Vantor Client");  // unchanged
}

TEST_F(ChangeLog, AMissingFileGivesAnEmptyChangelogAndAnErrorLine) {
  auto log = NubiloChangeLog::changeLogWithContentsOfFile(home.path() + "/missing.clog");
  ASSERT_TRUE(log);
  EXPECT_TRUE(log->changes().empty());
  EXPECT_TRUE(log->headers().empty());
  EXPECT_THAT(logText(), HasSubstr("|Error|Attempting to initialize ChangeLog with no Data, "
                                   "initializing with no changes instead\n"));
}

TEST_F(ChangeLog, TheCreatorEngineVersionIsTheEngines) {
  auto engine = vtc::engine::SyncEngine::open(home.path() + "/engine.sqlite");
  NubiloChangeLog log(sampleChanges());
  EXPECT_EQ(log.headerValueForKey("CreatorEngineVersion").string(), engine->version());
  EXPECT_EQ(engine->version(), vtc::engine::SyncEngine::bundleVersion());
}

// Nesting the reader refuses and texts a zero byte would cut are refused when
// writing, before the output is touched.
TEST_F(ChangeLog, TheWriterRefusesWhatReadersWouldRefuse) {
  auto nested = [](unsigned depth) {  // depth containers below the change list
    Value v(1);
    for (unsigned i = 0; i < depth; ++i) v = Value(Array{v});
    return v;
  };
  auto writeChange = [](Value value, std::string identifier = "r") {
    NubiloChangeLog log(std::vector<SyncEngineChange>{
        SyncEngineChange(1, std::move(identifier), Array{std::move(value)})});
    return log;
  };
  // The change list is at depth 0, so 127 more containers put the innermost
  // value at the deepest level read.
  NubiloChangeLog deepest = writeChange(nested(127));
  EXPECT_EQ(NubiloChangeLog(written(deepest)).changes(), deepest.changes());

  const Bytes untouched = {1, 2, 3};
  Bytes out = untouched;
  NubiloChangeLog tooDeep = writeChange(nested(128));
  EXPECT_THAT([&] { tooDeep.writeToData(out); },
              ThrowsMessage<std::invalid_argument>(
                  "Cannot write a property list nested deeper than 128 levels: readers refuse it"));
  EXPECT_EQ(out, untouched);
  NubiloChangeLog zeroInIdentifier = writeChange(Value(1), std::string("a\0b", 3));
  EXPECT_THAT([&] { zeroInIdentifier.writeToData(out); },
              ThrowsMessage<std::invalid_argument>(HasSubstr("record identifier holding a zero")));
  NubiloChangeLog zeroInHeader = writeChange(Value(1));
  zeroInHeader.setHeaderValue(Value(std::string("x\0y", 3)), "Note");
  EXPECT_THAT([&] { zeroInHeader.writeToData(out); },
              ThrowsMessage<std::invalid_argument>(HasSubstr("header holding a zero")));
  EXPECT_EQ(out, untouched);
}

// Random changelogs of every value kind, nesting up to the limit and long
// strings repeated: whatever the writer accepts comes back equal.
TEST_F(ChangeLog, EverythingTheWriterAcceptsIsReadBack) {
  std::mt19937 random(4711);
  auto text = [&](size_t maxLength) {
    static const char* kPieces[] = {
        "a", "Z", "0", " ", "=", "\xC3\xA9", "\xE2\x82\xAC", "\xF0\x9F\x98\x80"};
    std::string s;
    for (size_t n = random() % (maxLength + 1); s.size() < n;) s += kPieces[random() % 8];
    if (random() % 10 == 0) s += std::string(1, '\0');  // zero characters live in values
    return s;
  };
  std::function<Value(unsigned)> value = [&](unsigned depth) -> Value {
    switch (random() % (depth >= 127 ? 6 : 8)) {
      case 0:
        return Value(text(40));
      case 1:
        return Value(static_cast<long long>(random()) << (random() % 32) ^
                     -static_cast<long long>(random() % 2));
      case 2:
        return Value(static_cast<double>(random()) / 7.0);
      case 3:
        return Value(random() % 2 == 0);
      case 4:
        return Value(vtc::Date(std::chrono::seconds(random() % 4000000000LL)));
      case 5:
        return Value(Bytes(random() % 64, static_cast<uint8_t>(random())));
      case 6: {
        Array a;
        for (unsigned i = random() % 4; i > 0; --i) a.push_back(value(depth + 1));
        if (random() % 4 == 0) a.push_back(value(depth + 1));
        return Value(std::move(a));
      }
      default: {
        Dictionary d;
        for (unsigned i = random() % 4; i > 0; --i) d.set(text(12), value(depth + 1));
        return Value(std::move(d));
      }
    }
  };
  for (int round = 0; round < 60; ++round) {
    std::vector<SyncEngineChange> changes;
    for (unsigned i = random() % 6; i > 0; --i) {
      Array properties;
      for (unsigned p = random() % 5; p > 0; --p) properties.push_back(value(1));
      std::string id = text(30);
      std::erase(id, '\0');
      changes.emplace_back(random() % 5, id, std::move(properties));
    }
    NubiloChangeLog log(changes);
    std::string header = text(20);
    std::erase(header, '\0');
    log.setHeaderValue(Value(header), "Random");
    Bytes bytes = written(log);
    EXPECT_EQ(NubiloChangeLog(bytes).changes(), changes) << round;
  }
  // A long text repeated many times in one record is written out each time,
  // not shared: sharing it would ask the reader for more than it allows.
  Array repeated(40, Value(std::string(20000, 'n')));
  NubiloChangeLog log(std::vector<SyncEngineChange>{SyncEngineChange(2, "notes", repeated)});
  EXPECT_EQ(NubiloChangeLog(written(log)).changes().at(0).changes(), repeated);
  // Ten times as much inflates beyond what readers take from so few bytes.
  NubiloChangeLog bomb(std::vector<SyncEngineChange>{
      SyncEngineChange(2, "notes", Array(400, Value(std::string(20000, 'n'))))});
  Bytes untouched{1, 2, 3};
  EXPECT_THAT([&] { bomb.writeToData(untouched); },
              testing::ThrowsMessage<std::invalid_argument>(
                  testing::HasSubstr("readers refuse more than 256 times a changelog's size")));
  EXPECT_EQ(untouched, (Bytes{1, 2, 3}));
}

}  // namespace
