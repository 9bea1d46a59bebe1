// The text log: levels from the preferences, line forms, rolling, and the
// C entry point.
#include <gtest/gtest.h>

#include <sys/stat.h>

#include <filesystem>
#include <fstream>
#include <set>

#include "common/Logging.h"
#include "platform/fs/LocalPaths.h"
#include "platform/prefs/PreferenceStore.h"
#include "support/TestHome.h"

namespace {

class Log : public ::testing::Test {
 protected:
  vtc::test::TestHome home;

  void SetUp() override { vtc::log::resetForTesting(); }
  void TearDown() override { vtc::log::resetForTesting(); }

  void setPreference(const std::string& key, vtc::Value value, bool perHost = false) {
    auto scope = perHost ? vtc::prefs::Scope::CurrentHost : vtc::prefs::Scope::AnyHost;
    auto& store = vtc::prefs::PreferenceStore::shared();
    store.setValue(key, std::move(value), "com.korvo.VantorSync", scope);
    ASSERT_TRUE(store.synchronize("com.korvo.VantorSync", scope));
  }

  std::vector<std::string> lines() const {
    std::ifstream in(vtc::log::logFilePath());
    std::vector<std::string> out;
    for (std::string l; std::getline(in, l);) out.push_back(l);
    return out;
  }

  // Logs at each level -1..4 into a fresh file; the lines written.
  std::vector<std::string> logAllLevels() {
    std::filesystem::remove(vtc::log::logFilePath());
    for (int level = -1; level <= 4; ++level) VTC_LOG(level, "level %d", level);
    return lines();
  }
};

// The level word and message after the timestamp and thread fields.
std::string tail(const std::string& line, int fields) {
  size_t pos = 0;
  for (int i = 0; i < fields; ++i) pos = line.find('|', pos) + 1;
  return line.substr(pos);
}

TEST_F(Log, WithoutAConfiguredLevelOnlyErrorsAreWrittenShortToAPrivateFile) {
  auto l = logAllLevels();
  ASSERT_EQ(l.size(), 2u);
  EXPECT_EQ(tail(l[0], 2), "????|level -1");
  EXPECT_EQ(tail(l[1], 2), "Error|level 0");
  // yyyy-MM-dd HH:mm:ss:SSS|thread|word|message
  EXPECT_EQ(l[1].find('|'), 23u);
  EXPECT_EQ(l[1][19], ':');
  struct stat st {};
  ASSERT_EQ(::stat(vtc::log::logFilePath().c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0600u);
}

TEST_F(Log, LevelWordsInAnyCaseAndThePerHostValueWins) {
  // A computer with the bug-reporting tool logs Info unless a level is set.
  vtc::paths::makeDirectories(home.path() + "/.local/share/applications");
  std::ofstream(home.path() + "/.local/share/applications/Ticketer.desktop")
      << "[Desktop Entry]\nName=Ticketer\n";
  auto l = logAllLevels();
  ASSERT_EQ(l.size(), 4u);  // levels -1 to 2
  EXPECT_EQ(tail(l.back(), 2), "Info|level 2");
  // "verbose" is -1: only a call made at level -1 itself gets through.
  const std::pair<const char*, size_t> cases[] = {{"verbose", 1}, {"warn", 3},  {"gibberish", 3},
                                                  {"info", 4},    {"error", 2}, {"DeBuG", 5}};
  for (const auto& [word, written] : cases) {
    vtc::log::resetForTesting();
    setPreference("LoggingLevel", vtc::Value(word));
    EXPECT_EQ(logAllLevels().size(), written) << word;
  }
  // Debug writes the long form, with the caller's file and function.
  vtc::log::resetForTesting();
  setPreference("LoggingLevel", vtc::Value("error"));
  setPreference("LoggingLevel", vtc::Value("debug"), /*perHost=*/true);
  std::filesystem::remove(vtc::log::logFilePath());
  VTC_LOG_INFO("hello %@", "there");
  l = lines();
  ASSERT_EQ(l.size(), 1u);
  EXPECT_NE(l[0].find("|log_test.cc:"), std::string::npos) << l[0];
  EXPECT_NE(l[0].find("TestBody()|"), std::string::npos) << l[0];
  EXPECT_EQ(tail(l[0], 3), "Info|hello there");
}

TEST_F(Log, RollsOnlyPastFourMebibytesAndOnlyOncePerProcess) {
  std::string path = vtc::log::logFilePath();
  vtc::paths::makeDirectories(path.substr(0, path.find_last_of('/')));
  std::string rolled = path.substr(0, path.size() - 3) + "0.log";
  auto makeLog = [&](size_t size) {
    std::ofstream(path, std::ios::trunc) << std::string(size, 'x');
  };
  makeLog(4194304);
  VTC_LOG_ERROR("first");
  EXPECT_FALSE(std::filesystem::exists(rolled));

  vtc::log::resetForTesting();
  std::ofstream(rolled) << "old generation";
  makeLog(4194305);
  VTC_LOG_ERROR("second");
  EXPECT_EQ(std::filesystem::file_size(rolled), 4194305u);  // replaced the old generation
  EXPECT_EQ(lines().size(), 1u);

  vtc::log::resetForTesting();
  setPreference("RollLogs", vtc::Value(false));
  makeLog(4194305);
  VTC_LOG_ERROR("third");
  EXPECT_GT(std::filesystem::file_size(path), 4194305u);
}

TEST_F(Log, TheCEntryPointAndLongLinesAndHeadsStayWholeAndInvalidUtf8BecomesQuestionMarks) {
  setPreference("LoggingLevel", vtc::Value("debug"));
  // A function name that carries the head past 511 bytes, with two-byte
  // characters all the way, so that any cut would split one.
  std::string function = "-[Caller ";
  while (function.size() < 600) function += "\xC3\xA9";
  function += "]";
  _VTCLog("/src/a/Caller.m", 7, function.c_str(), 0, "%@", "the message");
  const std::string big(1000, 'y');
  _VTCLog("/src/a/Caller.m", 12, "-[Caller run]", 2, "%@ and %d: %@", "text", 5, big.c_str());
  _VTCLog("/src/a/Caller.m", 13, "-[Caller run]", 1, "%@", nullptr);
  auto l = lines();
  ASSERT_EQ(l.size(), 3u);
  EXPECT_NE(l[0].find("|Caller.m:7 " + function + "|"), std::string::npos) << l[0];
  EXPECT_EQ(tail(l[0], 3), "Error|the message");
  EXPECT_EQ(tail(l[1], 3), "Info|text and 5: " + big);
  EXPECT_EQ(tail(l[2], 3), "Warning|(null)");

  // Overlong forms, surrogates, lead bytes past U+10FFFF and stray or cut
  // sequences each become "?", byte by byte; well-formed text is kept.
  const std::pair<std::string, std::string> cases[] = {
      {"\xC0\xAF", "??"},
      {"\xE0\x80\xAF", "???"},
      {"\xF0\x80\x80\xAF", "????"},
      {"\xED\xA0\x80", "???"},
      {"\xED\xBF\xBF", "???"},
      {"\xF4\x90\x80\x80", "????"},
      {"\xF5\x80\x80\x80", "????"},
      {"\xF7\xBF\xBF\xBF", "????"},
      {"\x80x\xC3", "?x?"},
      {"\xC3\xA9\xE2\x82\xAC\xED\x9F\xBF\xF0\x9F\x98\x80\xF4\x8F\xBF\xBF",
       "\xC3\xA9\xE2\x82\xAC\xED\x9F\xBF\xF0\x9F\x98\x80\xF4\x8F\xBF\xBF"},
  };
  vtc::log::resetForTesting();
  std::filesystem::remove(vtc::log::logFilePath());
  for (const auto& [bytes, shown] : cases) VTC_LOG_ERROR("[%@]", bytes);
  l = lines();
  ASSERT_EQ(l.size(), std::size(cases));
  for (size_t i = 0; i < l.size(); ++i)
    EXPECT_EQ(tail(l[i], 3), "Error|[" + cases[i].second + "]") << i;
}

// With no folder to hold the log, lines are dropped for the rest of the
// process: nothing raised, nothing written anywhere else. The next process
// finds the folder again.
TEST_F(Log, AnUncreatableFolderDropsLinesSilently) {
  const std::string path = vtc::log::logFilePath();
  const std::string logs = path.substr(0, path.find("/Sync/"));
  std::filesystem::create_directories(std::filesystem::path(logs).parent_path());
  std::ofstream(logs) << "a file where the folder should be";
  auto everything = [&] {
    std::set<std::string> all;
    for (const auto& e : std::filesystem::recursive_directory_iterator(home.path()))
      all.insert(e.path().string());
    return all;
  };
  const auto before = everything();
  testing::internal::CaptureStderr();
  testing::internal::CaptureStdout();
  VTC_LOG_ERROR("dropped");
  _VTCLog("/src/a/Caller.m", 1, "f", 0, "%@", "dropped too");
  EXPECT_EQ(testing::internal::GetCapturedStdout(), "");
  EXPECT_EQ(testing::internal::GetCapturedStderr(), "");
  EXPECT_EQ(everything(), before);

  std::filesystem::remove(logs);
  VTC_LOG_ERROR("still dropped: the open is not retried in this process");
  EXPECT_FALSE(std::filesystem::exists(path));

  vtc::log::resetForTesting();  // as in the next process
  VTC_LOG_ERROR("written");
  auto l = lines();
  ASSERT_EQ(l.size(), 1u);
  EXPECT_EQ(tail(l[0], 2), "Error|written");
}

}  // namespace
