// The client's schedule as systemd runs it: units that systemd-analyze
// accepts, a timer on the clock for intervals that divide an hour or a day
// (its next elapse the one status announces) and after the last run for
// others, the installed client in ExecStart, wanted by default.target.
#include <gmock/gmock.h>
#include <sys/stat.h>

#include <filesystem>
#include <nlohmann/json.hpp>
#include <regex>

#include "localshare/ApacheShare.h"
#include "localshare/Computer.h"
#include "platform/process/Command.h"
#include "support/TestHome.h"

using testing::HasSubstr;
using vtc::local::ApacheShare;
using vtc::local::Computer;

namespace {

bool haveSystemdAnalyze() {
  return vtc::process::run({"systemd-analyze", "--version"}).status == 0;
}

TEST(Schedule, TheTimerRunsAtTheIntervalGivenAndSystemdAcceptsItsUnits) {
  vtc::test::TestHome home;
  ApacheShare share;
  Computer a{"Mac A"};
  // A user manager that accepts every request and records it.
  const std::string stubs = home.path() + "/stand-ins";
  std::filesystem::create_directories(stubs);
  Computer::write(stubs + "/systemctl",
                  "#!/bin/sh\nprintf '%s\\n' \"$*\" >> \"$HOME/.systemctl-calls\"\nexit 0\n");
  ::chmod((stubs + "/systemctl").c_str(), 0755);
  a.setEnvironment("PATH", stubs + ":" + std::getenv("PATH"));
  a.join("http://127.0.0.1:" + std::to_string(share.port()) + "/sync", ApacheShare::kUser,
         ApacheShare::kPassword);
  const std::string units = a.home() + "/.config/systemd/user/";
  const bool analyze = haveSystemdAnalyze();
  if (!analyze) std::cerr << "systemd-analyze is missing: the units are not verified\n";

  struct Case {
    const char* every;
    const char* cadence;
    const char* when;  // the timer's lines
    const char* calendar;
  };
  for (const Case& c :
       {Case{"15m", "every 15 minutes", "OnCalendar=*-*-* *:00/15:00\nPersistent=true\n",
             "*-*-* *:00/15:00"},
        Case{"30m", "every 30 minutes", "OnCalendar=*-*-* *:00/30:00\nPersistent=true\n",
             "*-*-* *:00/30:00"},
        Case{"2h", "every 2 hours", "OnCalendar=*-*-* 00/2:00:00\nPersistent=true\n",
             "*-*-* 00/2:00:00"},
        Case{"45m", "every 45 minutes", "OnStartupSec=2min\nOnUnitActiveSec=2700s\n", ""}}) {
    SCOPED_TRACE(c.every);
    Computer::Result on = a.run({"schedule", "on", "--every", c.every});
    ASSERT_EQ(on.status, 0) << on.err;
    EXPECT_EQ(on.out, std::string("Scheduled syncs are on: ") + c.cadence +
                          "; a sync missed while this computer slept or was off runs when it is "
                          "back.\n");
    const std::string timer = Computer::read(units + "nubilosyncclient.timer");
    const std::string service = Computer::read(units + "nubilosyncclient.service");
    EXPECT_THAT(timer, HasSubstr(std::string("[Timer]\n") + c.when +
                                 "Unit=nubilosyncclient.service\n\n[Install]\n"
                                 "WantedBy=default.target\n"));
    EXPECT_THAT(service,
                HasSubstr("ExecStart=" + vtc::local::clientProgram() + " --sync --periodic\n"));
    const nlohmann::json status =
        nlohmann::json::parse(a.run({"status", "--json"}).out)["schedule"];
    EXPECT_EQ(status["cadence"], c.cadence);
    if (!analyze) continue;
    vtc::process::CommandResult verified =
        vtc::process::run({"systemd-analyze", "verify", units + "nubilosyncclient.timer",
                           units + "nubilosyncclient.service"});
    EXPECT_EQ(verified.status, 0) << verified.err;
    EXPECT_EQ(verified.err, "");
    if (*c.calendar) {
      // systemd's next elapse is the one status announces.
      // In the local time zone, as the timer runs; its UTC form is compared.
      vtc::process::CommandResult next =
          vtc::process::run({"systemd-analyze", "calendar", c.calendar});
      std::smatch m;
      static const std::regex inUtc(R"(\(in UTC\): \w+ ([0-9-]+ [0-9:]+) UTC)"),
          utcHere(R"(Next elapse: \w+ ([0-9-]+ [0-9:]+) UTC)");
      ASSERT_TRUE(std::regex_search(next.out, m, inUtc) || std::regex_search(next.out, m, utcHere))
          << next.out;
      EXPECT_EQ(status["next"], std::string(m[1]) + " +0000");
    } else {
      vtc::process::CommandResult span =
          vtc::process::run({"systemd-analyze", "timespan", "2700s"});
      EXPECT_THAT(span.out, HasSubstr("Human: 45min"));
    }
  }
  const std::string calls = Computer::read(a.home() + "/.systemctl-calls");
  EXPECT_THAT(calls, HasSubstr("--user daemon-reload\n--user enable nubilosyncclient.timer\n"
                               "--user restart nubilosyncclient.timer\n"));

  Computer::Result off = a.run({"schedule", "off"});
  EXPECT_EQ(off.status, 0);
  EXPECT_FALSE(std::filesystem::exists(units + "nubilosyncclient.timer"));
  EXPECT_THAT(Computer::read(a.home() + "/.systemctl-calls"),
              HasSubstr("--user disable --now nubilosyncclient.timer\n"));
  EXPECT_THAT(a.run({"status"}).out, HasSubstr("Schedule: off\n"));
  EXPECT_EQ(a.run({"schedule", "on", "--every", "10x"}).status, 2);
}

}  // namespace
