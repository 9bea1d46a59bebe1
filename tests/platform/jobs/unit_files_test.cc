// The units made from job descriptions, checked by systemd's own tools:
// `systemd-analyze verify` accepts them, and the timers' next elapses that
// `systemd-analyze calendar` prints are the requested period apart and
// agree with the next due date the client shows.
#include <gmock/gmock.h>

#include <sys/stat.h>
#include <unistd.h>

#include <ctime>
#include <filesystem>
#include <fstream>
#include <regex>

#include "localshare/Computer.h"
#include "platform/jobs/UnitFiles.h"
#include "platform/process/Command.h"
#include "prefs/AutoSyncJobs.h"
#include "support/TestHome.h"

using testing::HasSubstr;
using vtc::Dictionary;
using vtc::Value;

namespace {

class Units : public ::testing::Test {
 protected:
  vtc::test::TestHome home;
  std::string folder = home.path() + "/units";
  Units() { std::filesystem::create_directories(folder + "/runtime"); }

  // Writes the job's units and runs `systemd-analyze --user verify` on them;
  // its whole output (empty when systemd has nothing to say).
  std::string verify(const Dictionary& job) {
    std::string error;
    auto units = vtc::jobs::unitsForJob(job, error);
    EXPECT_TRUE(units) << error;
    if (!units) return error;
    std::vector<std::string> argv{"env", "XDG_RUNTIME_DIR=" + folder + "/runtime",
                                  "systemd-analyze", "--user", "verify"};
    for (const auto& file : units->files) {
      vtc::local::Computer::write(folder + "/" + file.name, file.text);
      argv.push_back(folder + "/" + file.name);
    }
    ::chmod((folder + "/runtime").c_str(), 0700);
    vtc::process::CommandResult r = vtc::process::run(argv);
    return r.status == 0 ? r.out + r.err : "status " + std::to_string(r.status) + ": " + r.err;
  }
};

// The first two elapses of an OnCalendar= expression, as systemd computes
// them (in UTC, seconds since the epoch).
std::vector<std::time_t> elapses(const std::string& expression) {
  vtc::process::CommandResult r =
      vtc::process::run({"systemd-analyze", "calendar", "--iterations=2", expression});
  EXPECT_EQ(r.status, 0) << r.err;
  // "    Next elapse: Sun 2026-11-29 14:05:00 UTC" then, when the local zone
  // is another, "       (in UTC): Sun 2026-11-29 13:05:00 UTC"; the same
  // for "Iter. #2:".
  std::vector<std::time_t> times;
  static const std::regex line(R"(^\s*(Next elapse|Iter\. #2|\(in UTC\)): \w+ (\S+ \S+) (\S+))");
  std::istringstream lines(r.out);
  for (std::string text; std::getline(lines, text);) {
    std::smatch m;
    if (!std::regex_search(text, m, line)) continue;
    std::tm tm{};
    strptime(m[2].str().c_str(), "%Y-%m-%d %H:%M:%S", &tm);
    if (m[1] == "(in UTC)")
      times.back() = timegm(&tm);  // the UTC form of the line before
    else if (m[3] == "UTC")
      times.push_back(timegm(&tm));
    else
      times.push_back(-1);  // a local time: its UTC line follows
  }
  return times;
}

TEST_F(Units, ThePeriodicAndBookmarksJobsPassVerifyEvenWithSpacesAndPercentInTheirPaths) {
  // The program's folder name needs quoting and escaping: a mistake in
  // either makes verify look for a program that is not there.
  const std::string odd = home.path() + "/my 50% $HOME app";
  std::filesystem::create_directories(odd);
  std::filesystem::create_symlink(vtc::local::clientProgram(), odd + "/nubilosyncclient");
  std::tm now{};
  now.tm_wday = 3, now.tm_hour = 14, now.tm_min = 5;
  for (int64_t period : {30, 60, 3600, 7200, 86400, 172800}) {
    Dictionary job =
        vtc::autosync::periodicJobDescription(vtc::autosync::calendarForPeriod(period, now));
    job.set("ProgramArguments",
            Value(vtc::Array{Value(odd + "/nubilosyncclient"), "--sync", "--periodic"}));
    EXPECT_EQ(verify(job), "") << "period " << period;
  }
  Dictionary bookmarks = vtc::autosync::bookmarksJobDescription(odd + "/nubilosyncclient");
  EXPECT_EQ(verify(bookmarks), "");
  EXPECT_THAT(vtc::local::Computer::read(folder + "/com.korvo.Voyager.path"),
              HasSubstr("PathChanged=" + home.path() + "/Library/Voyager/Bookmarks.plist\n"));
  // A service that stays (the push listener) restarts; verify knows the keys.
  EXPECT_EQ(verify(Dictionary{
                {"Label", "com.korvo.NubiloPushListener"},
                {"ProgramArguments", Value(vtc::Array{Value(odd + "/nubilosyncclient"), "listen"})},
                {"RunAtLoad", true},
                {"KeepAlive", true}}),
            "");
}

TEST_F(Units, EachTimerElapsesAtTheRequestedPeriodAndWhenTheClientSaysItIsDue) {
  const std::time_t t = std::time(nullptr);
  std::tm now{};
  localtime_r(&t, &now);
  struct Case {
    int64_t period;  // requested
    int64_t apart;   // between two elapses
  } cases[] = {{60, 60},
               {3600, 3600},
               {86400, 86400},
               {7 * 86400, 7 * 86400},
               // coarse steps: two hours run daily, two days weekly
               {7200, 86400},
               {2 * 86400, 7 * 86400}};
  for (const Case& c : cases) {
    const Dictionary calendar = vtc::autosync::calendarForPeriod(c.period, now);
    std::optional<std::string> expression = vtc::jobs::onCalendar(calendar);
    ASSERT_TRUE(expression);
    // A minute that turns between the two computations moves both: ask again.
    std::vector<std::time_t> systemd;
    std::optional<vtc::Date> ours;
    for (int attempt = 0; attempt < 2; ++attempt) {
      ours = vtc::jobs::nextCalendarDate(calendar, std::chrono::system_clock::now());
      systemd = elapses(*expression);
      ASSERT_EQ(systemd.size(), 2u) << *expression;
      if (ours && std::chrono::system_clock::to_time_t(*ours) == systemd[0]) break;
    }
    EXPECT_EQ(systemd[1] - systemd[0], c.apart) << *expression;
    ASSERT_TRUE(ours);
    EXPECT_EQ(std::chrono::system_clock::to_time_t(*ours), systemd[0]) << *expression;
  }
}

TEST_F(Units, ACalendarOutOfRangeOrALabelThatCannotNameAUnitIsRefused) {
  std::string error;
  EXPECT_FALSE(
      vtc::jobs::unitsForJob(Dictionary{{"Label", "x"},
                                        {"ProgramArguments", Value(vtc::Array{"/bin/true"})},
                                        {"StartCalendarInterval", Value(Dictionary{{"Hour", 24}})}},
                             error));
  EXPECT_THAT(error, HasSubstr("out of range"));
  EXPECT_FALSE(vtc::jobs::unitsForJob(
      Dictionary{{"Label", "../x"}, {"ProgramArguments", Value(vtc::Array{"/bin/true"})}}, error));
  EXPECT_EQ(vtc::jobs::onCalendar(Dictionary{{"Weekday", 7}, {"Hour", 0}, {"Minute", 0}}),
            "Sun *-*-* 00:00:00");  // 7 is Sunday too
}

}  // namespace
