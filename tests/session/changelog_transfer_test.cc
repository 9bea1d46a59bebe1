// Changelogs travelling through the real share: the commit protocol step by
// step (requests counted in the server's access log), commits of real child
// processes killed at each step or racing for one index, faults at every
// request of a commit and of a fetch, the batched fetch, the directory
// operations and sync reporting.
#include <gmock/gmock.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <ctime>
#include <filesystem>
#include <fstream>
#include <functional>
#include <thread>

#include "VantorSyncManager/HostIdentity.h"
#include "VantorSyncManager/NubiloException.h"
#include "VantorSyncManager/PublicNames.h"
#include "common/Format.h"
#include "localshare/Processes.h"
#include "platform/dav/TesselSession.h"
#include "platform/os/HostIdentity.h"
#include "platform/plist/PlistCodec.h"
#include "session/SyncReport.h"
#include "support/FaultProxy.h"
#include "support/SessionBus.h"
#include "support/ShareTest.h"

using testing::HasSubstr;
using testing::StartsWith;

namespace {

constexpr const char* kDataclass = "com.korvo.Contacts";

// Changes whose values do not compress: a changelog of many is large.
std::vector<SyncEngineChange> noisyChanges(int count) {
  std::vector<SyncEngineChange> changes;
  uint64_t x = 88172645463325252ull;
  for (int i = 0; i < count; ++i) {
    std::string noise;
    for (int j = 0; j < 40; ++j) {
      x ^= x << 13, x ^= x >> 7, x ^= x << 17;
      noise += static_cast<char>('!' + x % 90);
    }
    changes.emplace_back(SyncEngineChange::kAdd, "noisy-" + std::to_string(i),
                         vtc::Array{vtc::Value(vtc::Dictionary{
                             {"action", "set"}, {"name", "NOTE"}, {"value", noise}})});
  }
  return changes;
}

std::vector<SyncEngineChange> someChanges(int count, const std::string& tag) {
  std::vector<SyncEngineChange> changes;
  for (int i = 0; i < count; ++i)
    changes.emplace_back(
        SyncEngineChange::kAdd, tag + "-" + std::to_string(i),
        vtc::Array{vtc::Value(vtc::Dictionary{{"action", "set"}, {"name", "FN"}, {"value", tag}})});
  return changes;
}

// "yyyy-MM-dd HH:mm:ss ZZZ" in GMT.
std::string gmtText(vtc::Date date) {
  const std::time_t t = std::chrono::system_clock::to_time_t(date);
  std::tm tm{};
  gmtime_r(&t, &tm);
  char text[64];
  std::strftime(text, sizeof text, "%Y-%m-%d %H:%M:%S +0000", &tm);
  return text;
}

// The failure's name and reason, or "none".
template <typename F>
std::pair<std::string, std::string> failureOf(F body) {
  try {
    body();
  } catch (const NubiloException& e) {
    return {e.name(), e.reason()};
  }
  return {"none", ""};
}

class ShareWithChangelogs : public vtc::test::ShareTest {
 protected:
  explicit ShareWithChangelogs(vtc::test::ShareKind kind = vtc::test::ShareKind::Apache)
      : ShareTest(kind) {}

  vtc::test::FaultProxy proxy{share.port()};
  std::unique_ptr<NubiloRemoteSession> session;

  void SetUp() override { session = open("GUID-A", 1); }

  // A session through the proxy, waiting readTimeout seconds for an answer.
  std::unique_ptr<NubiloRemoteSession> open(const std::string& guid, int readTimeout = 30) const {
    vtc::Dictionary overrides = clientOverrides(guid);
    overrides.merge({{"host_port", proxy.port()},
                     {"ClientName", "Mac of " + guid},
                     {"sync_dav_timeout_seconds", readTimeout}});
    return openSession(overrides);
  }

  std::string dataclassFolder(const std::string& dataclass) const {
    return share.diskPath(session->schemasPath() + "/" + dataclass);
  }
  std::vector<std::string> filesOf(const std::string& dataclass) const {
    std::vector<std::string> names;
    for (const auto& e : std::filesystem::directory_iterator(dataclassFolder(dataclass)))
      if (!e.path().filename().string().starts_with("."))  // the server's own property store
        names.push_back(e.path().filename().string());
    std::sort(names.begin(), names.end());
    return names;
  }
  bool hasTemporaryFile(const std::string& dataclass) const {
    for (const std::string& name : filesOf(dataclass))
      if (name.ends_with(".tmp")) return true;
    return false;
  }
  vtc::Dictionary record(const std::string& dataclass) {
    vtc::Dictionary r = session->getDataclassInfo(dataclass);
    r.erase("DAV:getetag");
    r.erase("displayname");
    r.erase("dataclassname");
    return r;
  }
  std::string maxversion(const std::string& dataclass) {
    return record(dataclass).get("maxversion").string();
  }
  // Commits `count` single-change changelogs 1..count, the first as a reset
  // that starts the record's range, as a dataclass's first sync does.
  void populate(const std::string& dataclass, int count) {
    session->getDataclassInfo(dataclass);
    for (int i = 1; i <= count; ++i)
      ASSERT_TRUE(
          session->commitChanges(someChanges(1, "c" + std::to_string(i)), dataclass, i, i == 1));
  }
};

// Commits and transfers that meet the servers' differences run on each;
// faults, races and fetches, which go through the proxy alike, on Apache.
using Commit = vtc::test::OnEachServer<ShareWithChangelogs>;
using Transfer = vtc::test::OnEachServer<ShareWithChangelogs>;
using CommitFaults = ShareWithChangelogs;
using Fetch = ShareWithChangelogs;
INSTANTIATE_TEST_SUITE_P(Servers, Commit, vtc::test::kEachServer, vtc::test::serverName);
INSTANTIATE_TEST_SUITE_P(Servers, Transfer, vtc::test::kEachServer, vtc::test::serverName);

TEST_P(Commit, PublishesWithThreeRequestsBeyondTheLockAndLeavesNoTemporaryFile) {
  session->getDataclassInfo(kDataclass);
  session->lockDataclass(kDataclass);
  const size_t before = share.accessEntries().size();
  const std::vector<SyncEngineChange> changes = someChanges(3, "first");
  ASSERT_TRUE(session->commitChanges(changes, kDataclass, 1, false));
  const auto entries = share.accessEntries();
  std::vector<std::string> methods;
  for (size_t i = before; i < entries.size(); ++i) methods.push_back(entries[i].method);
  EXPECT_EQ(methods, (std::vector<std::string>{"PUT", "PROPPATCH", "MOVE"}));
  session->unlockDataclass(kDataclass);

  EXPECT_EQ(filesOf(kDataclass), std::vector<std::string>{"00001.clog"});
  vtc::Dictionary r = record(kDataclass);
  EXPECT_EQ(r.get("maxversion").string(), "00001");
  EXPECT_FALSE(r.find("minversion"));  // only a reset commit sets it
  EXPECT_EQ(r.get("lastsync").string(), gmtText(time.now()));
  EXPECT_EQ(logged.count("Info", "com.korvo.Contacts Uploading changeLog with index 1"), 1u);

  // What another computer reads back: the changes and the creator headers.
  auto log = NubiloChangeLog::createChangeLogWithData(
      session->fetchChangeLogForDataclass(kDataclass, 1), 32768);
  EXPECT_EQ(log->changes(), changes);
  EXPECT_EQ(log->headerValueForKey("CreatorClientGuid").string(), "GUID-A");
  EXPECT_EQ(log->headerValueForKey("CreatorClientName").string(), "Mac of GUID-A");
  EXPECT_EQ(log->headerValueForKey("CreatorClientVersion").string(), "488");

  // A reset commit also starts the range and clears the status.
  session->setStatus(std::optional<std::string>("needstruth"), kDataclass);
  ASSERT_TRUE(session->commitChanges(changes, kDataclass, 2, true));
  r = record(kDataclass);
  EXPECT_EQ(r.get("minversion").string(), "00002");
  EXPECT_EQ(r.get("maxversion").string(), "00002");
  EXPECT_EQ(r.get("status").string(), "normal");
}

TEST_P(Commit, AnExistingChangelogIsOverwrittenOnlyWhenADayOld) {
  populate(kDataclass, 1);
  const std::string final = session->changeLogPathForDataclass(kDataclass, 2);
  session->tesselSession().putData({'o', 'l', 'd'}, final);

  // 23 hours: another client's fresh commit. The loser's file goes, the
  // record stays as this commit wrote it, naming the winner's file.
  time.advance(std::chrono::hours(23));
  auto [name, reason] =
      failureOf([&] { session->commitChanges(someChanges(1, "late"), kDataclass, 2, false); });
  EXPECT_EQ(name, NubiloServerIncoherencyException);
  EXPECT_EQ(reason, "Failed to move changelog into place to do incoherency");
  EXPECT_FALSE(hasTemporaryFile(kDataclass));
  EXPECT_EQ(maxversion(kDataclass), "00002");
  EXPECT_EQ(session->fetchChangeLogForDataclass(kDataclass, 2), (vtc::Bytes{'o', 'l', 'd'}));
  EXPECT_THAT(logged.messages("Warning"),
              testing::Contains(StartsWith("Last modified date for " + final)));

  // 25 hours: a leftover of an old failed commit, overwritten.
  time.advance(std::chrono::hours(2));
  EXPECT_TRUE(session->commitChanges(someChanges(1, "now"), kDataclass, 2, false));
  EXPECT_EQ(logged.count("Warning",
                         "Last Modified date more than 1 day ago which likely indicates a stale "
                         "changelog, overwriting..."),
            1u);
  EXPECT_EQ(NubiloChangeLog(session->fetchChangeLogForDataclass(kDataclass, 2)).changes(),
            someChanges(1, "now"));
  EXPECT_FALSE(hasTemporaryFile(kDataclass));

  // A failed reset commit takes both bounds away.
  proxy.answer({"MOVE", "", 0}, 500);
  EXPECT_EQ(
      failureOf([&] { session->commitChanges(someChanges(1, "r"), kDataclass, 3, true); }).first,
      NubiloTransactionFailureException);
  EXPECT_FALSE(record(kDataclass).find("minversion"));
  EXPECT_FALSE(record(kDataclass).find("maxversion"));
}

// Each request of a commit fails once in each way. The outcome is the
// exception of its kind and a server that a reader either does not notice
// or can repair from the files present.
TEST_F(CommitFaults, EachRequestFailingInEachWayLeavesARecoverableServer) {
  struct Case {
    const char* method;
    const char* fault;
    const char* failure;  // none: the commit still succeeds
    const char* reasonStart;
  } cases[] = {
      {"PUT", "drop", NubiloNetworkFailureException,
       "Upload transaction failed due to network error"},
      {"PUT", "507", NubiloTesselFullException, "Insufficient storage available to upload to path"},
      {"PUT", "500", NubiloTransactionFailureException, "Upload transaction failed"},
      {"PROPPATCH", "drop", NubiloNetworkFailureException, "PropPatch transaction failed"},
      {"PROPPATCH", "507", "none", ""},
      {"PROPPATCH", "500", "none", ""},
      {"MOVE", "drop", NubiloNetworkFailureException, "moveResource transaction failed"},
      {"MOVE", "507", NubiloTransactionFailureException, "Failed to move changelog from"},
      {"MOVE", "500", NubiloTransactionFailureException, "Failed to move changelog from"},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(std::string(c.method) + " " + c.fault);
    const std::string dataclass = std::string("dc.") + c.method + "." + c.fault;
    populate(dataclass, 1);
    proxy.clear();
    // neon resends once by itself when a kept-alive connection closes, so
    // a drop that is to be seen drops every attempt.
    if (std::string(c.fault) == "drop")
      proxy.dropConnection({c.method, "", 0});
    else
      proxy.answer({c.method, "", 1}, std::stoi(c.fault));
    auto [name, reason] =
        failureOf([&] { session->commitChanges(someChanges(2, "x"), dataclass, 2, false); });
    proxy.clear();
    EXPECT_EQ(name, c.failure);
    EXPECT_THAT(reason, StartsWith(c.reasonStart));

    const bool published = std::filesystem::exists(dataclassFolder(dataclass) + "/00002.clog");
    const std::string method = c.method;
    if (method == "PUT") {  // nothing visible
      EXPECT_FALSE(published);
      EXPECT_EQ(maxversion(dataclass), "00001");
    } else if (method == "PROPPATCH" && name == "none") {
      // The file is in place but the record lags: repaired from the files.
      EXPECT_TRUE(published);
      EXPECT_EQ(maxversion(dataclass), "00001");
      EXPECT_EQ(session->calculatePropertiesForDataclass(dataclass).get("maxversion").string(),
                "00002");
    } else if (method == "PROPPATCH") {  // a stray temporary file only
      EXPECT_FALSE(published);
      EXPECT_TRUE(hasTemporaryFile(dataclass));
      EXPECT_EQ(maxversion(dataclass), "00001");
    } else if (name == NubiloNetworkFailureException) {
      // The record names a file that is not there: detected and repaired.
      EXPECT_FALSE(published);
      EXPECT_EQ(maxversion(dataclass), "00002");
      EXPECT_FALSE(session->validPropertiesForDataclass(dataclass));
      session->setInfoForDataclass(session->calculatePropertiesForDataclass(dataclass), dataclass);
      EXPECT_TRUE(session->validPropertiesForDataclass(dataclass));
    } else {  // rolled back
      EXPECT_FALSE(published);
      EXPECT_FALSE(hasTemporaryFile(dataclass));
      EXPECT_EQ(maxversion(dataclass), "00001");
    }
    if (!published) {  // the next commit at the same index goes through
      EXPECT_TRUE(session->commitChanges(someChanges(1, "again"), dataclass, 2, false));
    }
  }
}

TEST_F(CommitFaults, ATimedOutUploadIsTriedExactlyOnceMoreUnderANewName) {
  auto quick = open("GUID-Q", 1);  // a second for an answer, the shortest time-out
  quick->getDataclassInfo(kDataclass);
  proxy.timeOut({"PUT", "", 1});
  ASSERT_TRUE(quick->commitChanges(someChanges(1, "slow"), kDataclass, 1, false));
  std::vector<std::string> puts;
  for (const auto& seen : proxy.requests())
    if (seen.method == "PUT") puts.push_back(seen.path);
  ASSERT_EQ(puts.size(), 2u);
  EXPECT_NE(puts[0], puts[1]);
  EXPECT_THAT(puts[1], StartsWith(quick->changeLogPathForDataclass(kDataclass, 1) + "."));
  EXPECT_THAT(logged.messages("Info"),
              testing::Contains("com.korvo.Contacts Upload of changeLog with index 1 failed "
                                "due to timeout retrying with new tmp path " +
                                puts[1] + "..."));
  EXPECT_EQ(maxversion(kDataclass), "00001");
  EXPECT_EQ(filesOf(kDataclass), std::vector<std::string>{"00001.clog"});

  // Two time-outs in a row: no third attempt.
  proxy.clear();
  proxy.timeOut({"PUT", "", 0});
  EXPECT_EQ(
      failureOf([&] { quick->commitChanges(someChanges(1, "x"), kDataclass, 2, false); }).first,
      NubiloTransactionFailureException);
  EXPECT_EQ(proxy.count("PUT"), 4u);
}

// A child process that commits, stopped for ever at one request and killed
// with SIGKILL there: the server holds what the steps before it did.
TEST_P(Commit, AProcessKilledAtEachStepLeavesNothingOrARepairableRecordOrTheWholeCommit) {
  for (const char* stopAt : {"PROPPATCH", "MOVE", "after"}) {
    SCOPED_TRACE(stopAt);
    const std::string dataclass = std::string("dc.kill.") + stopAt;
    populate(dataclass, 1);
    proxy.clear();
    if (std::string(stopAt) != "after") proxy.timeOut({stopAt, "", 1});
    int done[2];
    ASSERT_EQ(::pipe(done), 0);
    pid_t child = ::fork();
    if (child == 0) {
      auto s = open("GUID-K");
      s->lockDataclass(dataclass);
      s->commitChanges(someChanges(5, "killed"), dataclass, 2, false);
      (void)!::write(done[1], "d", 1);
      ::pause();
      ::_exit(0);
    }
    ::close(done[1]);
    if (std::string(stopAt) == "after") {
      char c;
      ASSERT_EQ(::read(done[0], &c, 1), 1);
    } else {
      ASSERT_TRUE(vtc::local::waitUntil([&] {
        for (const auto& seen : proxy.requests())
          if (seen.method == stopAt && seen.action == "timed out") return true;
        return false;
      }));
    }
    ::kill(child, SIGKILL);
    ::waitpid(child, nullptr, 0);
    ::close(done[0]);
    proxy.clear();
    share.forgetLocks();  // the dead process's lock, as if it had expired

    const bool published = std::filesystem::exists(dataclassFolder(dataclass) + "/00002.clog");
    if (published) {  // the whole commit
      EXPECT_EQ(std::string(stopAt), "after");
      EXPECT_TRUE(session->validPropertiesForDataclass(dataclass));
      EXPECT_EQ(session->fetchChangeLogsForDataclass(dataclass, 1, 2).changeLogs.at(2)->changes(),
                someChanges(5, "killed"));
      continue;
    }
    // No commit: a record naming the missing file is reported and repaired,
    // and the same index is then free for the next commit.
    EXPECT_EQ(session->validPropertiesForDataclass(dataclass), std::string(stopAt) == "PROPPATCH");
    if (!session->validPropertiesForDataclass(dataclass))
      session->setInfoForDataclass(session->calculatePropertiesForDataclass(dataclass), dataclass);
    EXPECT_EQ(maxversion(dataclass), "00001");
    session->lockDataclass(dataclass);
    EXPECT_TRUE(session->commitChanges(someChanges(1, "next"), dataclass, 2, false));
    session->unlockDataclass(dataclass);
    EXPECT_TRUE(session->validPropertiesForDataclass(dataclass));
  }
}

// Sleeps for real, a thousandth of what is asked: lock back-off between
// processes that really contend.
struct BriefSleeper : vtc::Sleeper {
  void sleepFor(vtc::Seconds d) override { std::this_thread::sleep_for(d / 1000); }
};

// Two processes commit the same index at the same moment, a hundred times.
// Each took the index from the record before it held the dataclass lock,
// as a computer whose lock expired while it slept would: the lock makes one
// wait for the other, and the move that refuses to overwrite turns the
// second commit away.
TEST_F(CommitFaults, TwoProcessesRacingForOneIndexHaveExactlyOneWinnerEveryRound) {
  constexpr int kRounds = 100;
  session->getDataclassInfo(kDataclass);
  struct Racer {
    pid_t pid;
    int go;       // parent writes one byte per round
    int outcome;  // child answers 'W' (won), 'L' (lost to incoherency) or 'E'
  };
  auto startRacer = [&](const std::string& guid) {
    int go[2], outcome[2];
    EXPECT_EQ(::pipe(go), 0);
    EXPECT_EQ(::pipe(outcome), 0);
    pid_t pid = ::fork();
    if (pid == 0) {
      ::close(go[1]);
      ::close(outcome[0]);
      BriefSleeper brief;
      vtc::installSleeper(&brief);
      vtc::Dictionary overrides = clientOverrides(guid);
      overrides.merge({{"ClientName", guid},
                       {"max_lock_acquire_attempts", 50},
                       {"lock_acquire_sleep_seconds", 1}});
      auto s = openSession(overrides);
      char c;
      for (int round = 1; ::read(go[0], &c, 1) == 1; ++round) {
        char result = 'E';
        try {
          s->lockDataclass(kDataclass);
          if (s->commitChanges(someChanges(2, guid + "-" + std::to_string(round)), kDataclass,
                               round, false))
            result = 'W';
        } catch (const NubiloException& e) {
          if (e.name() == NubiloServerIncoherencyException) result = 'L';
        }
        s->unlockDataclass(kDataclass);
        (void)!::write(outcome[1], &result, 1);
      }
      ::_exit(0);
    }
    ::close(go[0]);
    ::close(outcome[1]);
    return Racer{pid, go[1], outcome[0]};
  };
  Racer a = startRacer("RACER-A"), b = startRacer("RACER-B");
  int wins[2] = {0, 0};
  for (int round = 1; round <= kRounds; ++round) {
    ASSERT_EQ(::write(a.go, "g", 1), 1);
    ASSERT_EQ(::write(b.go, "g", 1), 1);
    char ra = 0, rb = 0;
    ASSERT_EQ(::read(a.outcome, &ra, 1), 1);
    ASSERT_EQ(::read(b.outcome, &rb, 1), 1);
    ASSERT_TRUE((ra == 'W' && rb == 'L') || (ra == 'L' && rb == 'W')) << round << ra << rb;
    const std::string winner = ra == 'W' ? "RACER-A" : "RACER-B";
    ++wins[ra == 'W' ? 0 : 1];
    auto won = NubiloChangeLog(session->fetchChangeLogForDataclass(kDataclass, round));
    ASSERT_EQ(won.headerValueForKey("CreatorClientGuid").string(), winner);
    ASSERT_EQ(won.changes(), someChanges(2, winner + "-" + std::to_string(round)));
    ASSERT_EQ(maxversion(kDataclass), vtc::format("%05i", round));
  }
  // Both go ends first: each child also holds the one made before it.
  for (Racer r : {a, b}) ::close(r.go);
  for (Racer r : {a, b}) {
    ::waitpid(r.pid, nullptr, 0);
    ::close(r.outcome);
  }
  EXPECT_FALSE(hasTemporaryFile(kDataclass));
  EXPECT_EQ(filesOf(kDataclass).size(), static_cast<size_t>(kRounds));
  std::printf("racing commits: A won %d, B won %d of %d rounds\n", wins[0], wins[1], kRounds);
}

TEST_F(Fetch, GrowingBatchesAHoleInsideTheRangeMappedLargeChangelogsAndACancel) {
  vtc::test::SessionBus bus;
  vtc::test::NotificationListener progress;
  populate(kDataclass, 19);
  EXPECT_FALSE(session->commitChanges({}, kDataclass, 20, false));  // nothing, not even progress
  // The twentieth is large enough to be held in a mapped file.
  ASSERT_TRUE(session->commitChanges(noisyChanges(2000), kDataclass, 20, false));
  auto fetched = session->fetchChangeLogsForDataclass(kDataclass, 1, 20);
  // Progress reached the user's other programs: one per commit, then the fetch's.
  std::vector<vtc::test::NotificationListener::Received> told;
  for (int i = 0; i < 50 && told.size() < 21; ++i)
    for (auto& r : progress.waitFor(std::chrono::milliseconds(200))) told.push_back(r);
  ASSERT_EQ(told.size(), 21u);
  for (size_t i = 0; i < told.size(); ++i) {
    EXPECT_EQ(told[i].name, NubiloSyncProgressNotification) << i;
    EXPECT_EQ(told[i].object, kDataclass) << i;
    EXPECT_EQ(told[i].information.empty(), i < 20) << i;
  }

  ASSERT_EQ(fetched.changeLogs.size(), 20u);
  EXPECT_EQ(fetched.changeLogs.at(7)->changes(), someChanges(1, "c7"));
  EXPECT_TRUE(dynamic_cast<NubiloMappedChangelog*>(fetched.changeLogs.at(20).get()));
  EXPECT_FALSE(dynamic_cast<NubiloMappedChangelog*>(fetched.changeLogs.at(19).get()));
  EXPECT_EQ(fetched.changeLogs.at(20)->changes().size(), 2000u);
  int64_t total = 0;
  for (const std::string& name : filesOf(kDataclass))
    total +=
        static_cast<int64_t>(std::filesystem::file_size(dataclassFolder(kDataclass) + "/" + name));
  EXPECT_EQ(fetched.StorageConsumed, total);
  EXPECT_EQ(logged.count("Info", "Downloaded changelog 3 (" +
                                     std::to_string(std::filesystem::file_size(
                                         dataclassFolder(kDataclass) + "/00003.clog")) +
                                     " bytes) of 20 for dataclass com.korvo.Contacts"),
            1u);

  // Batches grow from 5 changelogs and stop growing at 257.
  for (int i = 21; i <= 800; ++i)
    std::filesystem::copy_file(dataclassFolder(kDataclass) + "/00001.clog",
                               dataclassFolder(kDataclass) + vtc::format("/%05i.clog", i));
  EXPECT_EQ(session->fetchChangeLogsForDataclass(kDataclass, 1, 800).changeLogs.size(), 800u);
  const std::pair<const char*, size_t> batches[] = {{"1 to 5", 2},     {"6 to 14", 2},
                                                    {"15 to 20", 1},   {"259 to 515", 1},
                                                    {"516 to 772", 1}, {"773 to 800", 1}};
  for (const auto& [batch, fetches] : batches)
    EXPECT_EQ(logged.count("Info", std::string("Processing batched clogs from ") + batch +
                                       " for com.korvo.Contacts"),
              fetches)
        << batch;

  // A single index; a 404 there is a failed download. Inside a range it is
  // a hole in the stream.
  EXPECT_EQ(session->fetchChangeLogsForDataclass(kDataclass, 3, 3).changeLogs.size(), 1u);
  std::filesystem::remove(dataclassFolder(kDataclass) + "/00005.clog");
  auto missing = [&](int64_t from, int64_t to) {
    return failureOf([&] { session->fetchChangeLogsForDataclass(kDataclass, from, to); });
  };
  EXPECT_EQ(missing(5, 5).first, NubiloFailedToDownloadChangelogException);
  EXPECT_EQ(missing(3, 5).first, NubiloFailedToDownloadChangelogException);
  EXPECT_EQ(missing(5, 9).first, NubiloFailedToDownloadChangelogException);
  auto [name, reason] = missing(3, 9);
  EXPECT_EQ(name, NubiloCorruptChangelogException);
  EXPECT_THAT(reason, StartsWith("failed to download changelog due to 404 error for dataclass "
                                 "com.korvo.Contacts with index 5 transaction"));
  // Each 404 was asked once more after a pause, through the sleeper.
  EXPECT_EQ(time.sleeps(), std::vector<double>(4, 30.0));

  // Negative bounds fetch nothing. A cancel while the third downloads ends
  // the fetch after that download; no later batch asks for anything.
  EXPECT_TRUE(session->fetchChangeLogsForDataclass(kDataclass, -1, 4).changeLogs.empty());
  proxy.clear();
  const size_t gets = proxy.count("GET");
  proxy.delay({"GET", session->changeLogPathForDataclass(kDataclass, 3), 1}, 300);
  std::thread canceller([&] {
    vtc::local::waitUntil([&] { return proxy.count("GET") == gets + 3; });
    session->cancel();
  });
  auto cancelled = session->fetchChangeLogsForDataclass(kDataclass, 1, 4);
  canceller.join();
  EXPECT_EQ(cancelled.changeLogs.size(), 3u);
  EXPECT_EQ(proxy.count("GET"), gets + 3);
  EXPECT_TRUE(session->fetchChangeLogsForDataclass(kDataclass, 1, 2).changeLogs.empty());
}

TEST_F(Fetch, EachDownloadFailingInEachWayRaisesItsKind) {
  populate(kDataclass, 5);
  const std::string third = session->changeLogPathForDataclass(kDataclass, 3);
  struct Case {
    const char* fault;
    const char* failure;
  } cases[] = {{"drop", NubiloNetworkFailureException},
               {"500", NubiloFailedToDownloadChangelogException},
               {"507", NubiloFailedToDownloadChangelogException},
               {"timeout", "none"}};
  auto quick = open("GUID-Q", 1);
  for (const Case& c : cases) {
    SCOPED_TRACE(c.fault);
    proxy.clear();
    const std::string fault = c.fault;
    if (fault == "drop")
      proxy.dropConnection({"GET", third, 0});
    else if (fault == "timeout")
      proxy.timeOut({"GET", third, 1});
    else
      proxy.answer({"GET", third, 1}, std::stoi(fault));
    vtc::ChangeLogFetchResult result;
    auto [name, reason] =
        failureOf([&] { result = quick->fetchChangeLogsForDataclass(kDataclass, 1, 5); });
    EXPECT_EQ(name, c.failure);
    if (name == NubiloFailedToDownloadChangelogException) {
      EXPECT_THAT(reason, StartsWith("Failed to download changelog for dataclass "
                                     "com.korvo.Contacts with index 3 transaction"));
    }
    if (name == "none") {
      EXPECT_EQ(result.changeLogs.size(), 5u);
    }
  }
  proxy.clear();
  proxy.answer({"GET", third, 0}, 500);
  EXPECT_EQ(failureOf([&] { quick->fetchChangeLogForDataclass(kDataclass, 3); }).first,
            NubiloFailedToDownloadChangelogException);
  // The two refusals of the batched fetch and the single one were reported
  // as final under the fetch's own messages (a dropped connection under the
  // request's).
  std::vector<std::string> finals;
  for (const auto& r : traces.withDomain("com.korvo.sync.nubilosession.retrytransaction.final"))
    finals.push_back(vtc::test::TraceCapture::field(r, "MESSAGE"));
  EXPECT_EQ(std::ranges::count(finals, "Failed to get attributes on changelog"), 2);
  EXPECT_EQ(std::ranges::count(finals, "Failed download changelog"), 1);

  // A changelog of no bytes, answered 200, is an empty one: damage, whichever
  // fetch meets it, and nothing of it is left in the temporary folder.
  proxy.clear();
  std::filesystem::resize_file(dataclassFolder(kDataclass) + "/00003.clog", 0);
  const std::string temporary = home.path() + "/tmp";
  std::filesystem::create_directories(temporary);
  const std::optional<std::string> was =
      std::getenv("TMPDIR") ? std::optional<std::string>(std::getenv("TMPDIR")) : std::nullopt;
  ::setenv("TMPDIR", temporary.c_str(), 1);
  for (auto fetch : std::vector<std::function<void()>>{
           [&] { quick->fetchChangeLogsForDataclass(kDataclass, 1, 5); },
           [&] { quick->fetchChangeLogForDataclass(kDataclass, 3); }}) {
    auto [name, reason] = failureOf(fetch);
    EXPECT_EQ(name, NubiloCorruptChangelogException);
    EXPECT_THAT(reason, StartsWith("Empty changelog found for dataclass com.korvo.Contacts with "
                                   "index 3 transaction"));
  }
  EXPECT_TRUE(std::filesystem::is_empty(temporary));
  was ? ::setenv("TMPDIR", was->c_str(), 1) : ::unsetenv("TMPDIR");
}

TEST_P(Transfer, DirectoriesOfChangelogsAndTakingBackTheNewestCommit) {
  populate(kDataclass, 3);
  const std::string local = home.path() + "/copies";
  session->downloadChangeLogsForDataclass(kDataclass, local);
  for (int i = 1; i <= 3; ++i)
    EXPECT_EQ(NubiloChangeLog::changeLogWithContentsOfFile(local + "/" + kDataclass + "/" +
                                                           vtc::format("%05i.clog", i))
                  ->changes(),
              someChanges(1, "c" + std::to_string(i)));

  // Uploads widen the record from minversion, never from maxversion.
  session->registerClient("GUID-A", "Mac of GUID-A");
  session->setInfoForDataclass(vtc::Dictionary{{"minversion", "00010"}, {"maxversion", "00020"}},
                               kDataclass);
  const std::string upload = home.path() + "/upload";
  std::filesystem::create_directories(upload + "/nested");
  std::filesystem::copy_file(local + "/" + kDataclass + "/00001.clog", upload + "/00021.clog");
  std::filesystem::copy_file(local + "/" + kDataclass + "/00002.clog",
                             upload + "/nested/00022.clog");
  std::ofstream(upload + "/notes.txt") << "not a changelog";
  // Each entry takes as long as a whole lock lasts: both locks are renewed
  // before each, once half the lock duration has passed (the two PUTs come
  // after the two first locks and the first renewal, then two entries apart).
  const size_t before = proxy.requests().size();
  time.advanceOnEveryReading(vtc::Seconds(240));
  session->putChangeLogsFromDirectory(upload, kDataclass, "needstruth", false);
  time.advanceOnEveryReading(vtc::Seconds(0));
  const auto seen = proxy.requests();
  std::vector<int> locksBeforeEachPut{0};
  for (size_t i = before; i < seen.size(); ++i) {
    const std::string& method = seen[i].method;
    if (method == "LOCK") ++locksBeforeEachPut.back();
    if (method == "PUT") locksBeforeEachPut.push_back(0);
  }
  locksBeforeEachPut.pop_back();
  EXPECT_EQ(locksBeforeEachPut, (std::vector<int>{4, 4}));
  vtc::Dictionary r = record(kDataclass);
  EXPECT_EQ(r.get("minversion").string(), "00010");
  EXPECT_EQ(r.get("maxversion").string(), "00022");
  EXPECT_TRUE(std::filesystem::exists(dataclassFolder(kDataclass) + "/00022.clog"));
  EXPECT_FALSE(std::filesystem::exists(dataclassFolder(kDataclass) + "/notes.txt"));
  EXPECT_EQ(session->getClientInfo("GUID-A").get(std::string(kDataclass) + ".status").string(),
            "needstruth");
  EXPECT_TRUE(session->lockedResources().empty());

  const std::string low = home.path() + "/low";
  std::filesystem::create_directories(low);
  std::filesystem::copy_file(local + "/" + kDataclass + "/00001.clog", low + "/00005.clog");
  session->putChangeLogsFromDirectory(low, kDataclass, "normal", false);
  EXPECT_EQ(record(kDataclass).get("minversion").string(), "00005");
  EXPECT_EQ(record(kDataclass).get("maxversion").string(), "00010");

  // Taking back the only changelog leaves maxversion one below minversion.
  session->setInfoForDataclass(vtc::Dictionary{{"minversion", "00004"}, {"maxversion", "00004"}},
                               kDataclass);
  session->uploadChangeLog(session->fetchChangeLogForDataclass(kDataclass, 1), kDataclass, 4);
  EXPECT_TRUE(session->changeLogExistsForDataclass(kDataclass, 4));
  EXPECT_TRUE(session->removeLastChangelogForDataclass(kDataclass));
  EXPECT_FALSE(session->changeLogExistsForDataclass(kDataclass, 4));
  EXPECT_EQ(record(kDataclass).get("maxversion").string(), "00003");
  EXPECT_FALSE(record(kDataclass).find("status"));
  EXPECT_EQ(session->getClientInfo("GUID-A").get(std::string(kDataclass) + ".status").string(),
            "needstruth");
  session->setInfoForDataclass(vtc::Dictionary{{"maxversion", kNBRemoveProp}}, kDataclass);
  EXPECT_FALSE(session->removeLastChangelogForDataclass(kDataclass));

  // Cleared first: only what was uploaded is there, and the range is its own.
  session->putChangeLogsFromDirectory(upload, kDataclass, "normal", true);
  EXPECT_EQ(logged.count("Info", "Clearing changelogs for dataclass: com.korvo.Contacts"), 1u);
  EXPECT_EQ(filesOf(kDataclass), (std::vector<std::string>{"00021.clog", "00022.clog"}));
  EXPECT_EQ(record(kDataclass).get("minversion").string(), "00021");
  EXPECT_EQ(record(kDataclass).get("maxversion").string(), "00022");
}

TEST_P(Transfer, ReportsAreFlattenedAndStoredUnderTheMachinesUUID) {
  const vtc::Date start = time.now();
  vtc::Dictionary summary{
      {"GlobalSyncDuration", 2.5},
      {"SyncType", "manual"},
      {"Contacts", vtc::Dictionary{{"ClogCount", 3},
                                   {"SyncStart", start},
                                   {"SyncEnd", std::chrono::system_clock::from_time_t(1299230430)},
                                   {"SyncDuration", 0.1},
                                   {"SyncMode", "slow"},
                                   {"Error", "NubiloLockFailureException"}}},
      {"Calendars", vtc::Dictionary{}},
  };
  EXPECT_EQ(vtc::flattenedSyncReport(summary, "apache-1", "UUID-1"),
            (vtc::Dictionary{{"appName", "Granite"},
                             {"Version", "1"},
                             {"SyncStatus:code", "0"},
                             {"SyncStatus:syncType", "manual"},
                             {"SyncStatus:duration", "2.5"},
                             {"RespondingServer", "apache-1"},
                             {"MachineGUID", "UUID-1"},
                             {"Contacts:startTime", gmtText(start)},
                             {"Contacts:endTime", "2011-03-04 09:20:30 +0000"},
                             {"Contacts:duration", "0.1"},  // the shortest text of the number
                             {"Contacts:clogCount", "3"},
                             {"Contacts:syncMode", "slow"},
                             {"Contacts:code", "NubiloLockFailureException"},
                             {"Calendars:code", "0"}}));
  EXPECT_EQ(vtc::flattenedSyncReport({}, std::nullopt, std::nullopt),
            (vtc::Dictionary{{"appName", "Granite"}, {"Version", "1"}, {"SyncStatus:code", "0"}}));

  // Without a host UUID the report names no machine and is stored under
  // the client's guid.
  std::ofstream(home.path() + "/machine-id") << "0123456789abcdef0123456789abcdef\n";
  vtc::forgetHostUUIDForTesting();
  vtc::os::setIdentityFileForTesting(home.path() + "/missing");
  EXPECT_FALSE(getHostUUIDString());
  EXPECT_THAT(logged.messages("Warning"),
              testing::Contains("getHostUUIDString: unable to determine UUID for host. "
                                "Error: 2"));
  session->sendReportingInfo(summary);
  auto anonymous =
      vtc::plist::readFile(share.diskPath(session->syncPath() + "/Reports/GUID-A.plist"));
  ASSERT_TRUE(anonymous);
  EXPECT_FALSE(anonymous->dictionary().find("MachineGUID"));
  EXPECT_EQ(anonymous->dictionary().get("Contacts:clogCount").string(), "3");

  // The machine id keyed with the application's id: never the id itself.
  vtc::os::setIdentityFileForTesting(home.path() + "/machine-id");
  EXPECT_EQ(getHostUUIDString(), "741A1DFD-7F8E-4733-9325-6F6DBE2C9B34");
  vtc::os::setIdentityFileForTesting(home.path() + "/missing");  // kept once found
  EXPECT_EQ(getHostUUIDString(), "741A1DFD-7F8E-4733-9325-6F6DBE2C9B34");
  // Derived as systemd derives an application's id from this machine's.
  if (std::filesystem::exists("/etc/machine-id")) {
    int error = 0;
    vtc::os::setIdentityFileForTesting("");
    const std::optional<std::string> system = vtc::os::hostUUID(error);
    std::filesystem::copy_file("/etc/machine-id", home.path() + "/copy-of-machine-id");
    vtc::os::setIdentityFileForTesting(home.path() + "/copy-of-machine-id");
    EXPECT_EQ(vtc::os::hostUUID(error), system);
    std::string hex = system.value_or("");
    std::erase(hex, '-');
    std::ranges::transform(hex, hex.begin(), [](char c) { return std::tolower(c); });
    EXPECT_NE(hex, vtc::os::machineId());
  }

  session->sendReportingInfo(summary);
  auto stored = vtc::plist::readFile(
      share.diskPath(session->syncPath() + "/Reports/741A1DFD-7F8E-4733-9325-6F6DBE2C9B34.plist"));
  ASSERT_TRUE(stored);
  EXPECT_EQ(stored->dictionary().get("Contacts:clogCount").string(), "3");
  EXPECT_EQ(stored->dictionary().get("RespondingServer").string(),
            session->respondingServer().value_or("?"));
  vtc::os::setIdentityFileForTesting("");
  vtc::forgetHostUUIDForTesting();
}

}  // namespace
