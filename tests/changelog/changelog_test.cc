// Changelogs written and read back byte for byte, damaged ones refused,
// mapped ones decoded lazily, and the crash flags that guard decoding.
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <stdexcept>

#include "VantorSyncManager/NubiloChangeLog.h"
#include "VantorSyncManager/NubiloDataAdditions.h"
#include "VantorSyncManager/NubiloException.h"
#include "VantorSyncManager/PublicNames.h"
#include "changelog/ChangeLogFormat.h"
#include "platform/plist/PlistCodec.h"
#include "support/TestHome.h"

using vtc::Array;
using vtc::Bytes;
using vtc::Dictionary;
using vtc::Value;

namespace {

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

class ChangeLog : public ::testing::Test {
 protected:
  vtc::test::TestHome home;
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
  EXPECT_THROW(mapped->setHeaderValue(Value("x"), "Key"), std::invalid_argument);
  EXPECT_THROW(mapped->setSchemaVersions(Array{}), std::invalid_argument);

  EXPECT_EQ(mapped->changes(), sampleChanges());
  EXPECT_TRUE(mapped->isDecoded());
  EXPECT_NE(mapped->description().find("Num Records:3"), std::string::npos);
  Bytes fresh;
  mapped->writeToData(fresh);
  EXPECT_EQ(NubiloChangeLog(fresh).changes(), sampleChanges());
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
  EXPECT_THROW(NubiloChangeLog{bytes}, NubiloException);  // the third is refused
  EXPECT_FALSE(std::filesystem::exists(flag));
  EXPECT_EQ(NubiloChangeLog{bytes}.changes().size(), 3u);  // and the count starts again
}

}  // namespace
