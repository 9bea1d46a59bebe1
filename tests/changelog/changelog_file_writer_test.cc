// A changelog written record by record into a file reads back as the
// changes and headers given, as one written whole does.
#include <gtest/gtest.h>

#include "VantorSyncManager/NubiloChangeLog.h"
#include "changelog/ChangeLogFileWriter.h"
#include "support/TestHome.h"

namespace {

using vtc::Array;
using vtc::Dictionary;
using vtc::Value;

TEST(ChangeLogFileWriter, WritesWhatTheReaderReadsBackAndRefusesWhatItWouldRefuse) {
  vtc::test::TestHome home;
  std::vector<SyncEngineChange> changes;
  for (int i = 0; i < 3000; ++i)
    changes.emplace_back(
        i % 3 + 1, "record-" + std::to_string(i),
        Array{Value(Dictionary{{"action", "set"},
                               {"name", "NOTE"},
                               {"value", Value(std::string(50 + i % 700, 'a' + i % 26))}})});
  vtc::clog::ChangeLogFileWriter writer(home.path());
  writer.setHeaderValue(Value("Mac A"), "CreatorClientName");
  writer.setSchemaVersions(Array{
      Value(Dictionary{{"Name", "com.korvo.Contacts"}, {"MajorVersion", 1}, {"MinorVersion", 2}})});
  for (const SyncEngineChange& c : changes) writer.append(c);
  EXPECT_THROW(writer.append(SyncEngineChange(1, std::string("a\0b", 3), Array{})),
               std::invalid_argument);
  EXPECT_EQ(writer.count(), changes.size());
  const std::string path = home.path() + "/00001.clog";
  writer.finish(path);

  auto read = NubiloChangeLog::changeLogWithContentsOfFile(path);
  EXPECT_EQ(read->changes(), changes);
  EXPECT_EQ(read->headerValueForKey("CreatorClientName"), Value("Mac A"));
  EXPECT_EQ(read->headerValueForKey("com.korvo.Contacts.Version"), Value("1.2"));
  EXPECT_EQ(read->headerValueForKey("CreatorClientType"), Value("Vantor Client"));
  EXPECT_FALSE(read->headerValueForKey("CreationTimestamp").isNone());
  // An empty one, too.
  vtc::clog::ChangeLogFileWriter none(home.path());
  none.finish(home.path() + "/00002.clog");
  EXPECT_TRUE(
      NubiloChangeLog::changeLogWithContentsOfFile(home.path() + "/00002.clog")->changes().empty());
}

}  // namespace
