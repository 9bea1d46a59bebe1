#include "client/run/ClientSchedule.h"

#include <unistd.h>

#include <array>
#include <ctime>
#include <filesystem>

#include "VantorSyncManager/PublicNames.h"
#include "common/Format.h"
#include "platform/fs/AtomicWrite.h"
#include "platform/fs/LocalPaths.h"
#include "platform/jobs/UnitFiles.h"
#include "platform/jobs/UserManager.h"
#include "platform/prefs/PreferenceStore.h"

namespace vtc::client {

namespace {

constexpr const char* kScheduleKey = "ScheduleEvery";  // "30m", as typed

std::string unitPath(const char* suffix) {
  return paths::join(jobs::unitsFolder(), std::string(kScheduleUnit) + suffix);
}

// The installed client: the program running now.
std::string thisProgram() {
  std::error_code error;
  const auto path = std::filesystem::read_symlink("/proc/self/exe", error);
  return error ? std::string("nubilosyncclient") : path.string();
}

std::string textOfEvery(const ScheduleEvery& every) {
  const char units[] = {'m', 'h', 'd', 's'};
  return std::to_string(every.interval) + units[every.unit & 3];
}

}  // namespace

int64_t secondsOf(const ScheduleEvery& every) {
  const int64_t unit[] = {60, 3600, 86400, 1};
  return every.interval * unit[every.unit & 3];
}

std::string cadenceOf(const ScheduleEvery& every) {
  const char* const words[][2] = {
      {"minute", "minutes"}, {"hour", "hours"}, {"day", "days"}, {"second", "seconds"}};
  const auto& word = words[every.unit & 3];
  if (every.interval == 1) return std::string("every ") + word[0];
  return "every " + std::to_string(every.interval) + " " + word[1];
}

std::optional<std::string> calendarOf(const ScheduleEvery& every) {
  const int64_t n = every.interval;
  if (every.unit == 0 && n < 60 && 60 % n == 0)
    return n == 1 ? "*-*-* *:*:00" : format("*-*-* *:00/%lld:00", static_cast<long long>(n));
  if (every.unit == 0 && n % 60 == 0 && 24 % (n / 60) == 0)
    return format("*-*-* 00/%lld:00:00", static_cast<long long>(n / 60));
  if (every.unit == 1 && n <= 24 && 24 % n == 0)
    return n == 1 ? "*-*-* *:00:00" : format("*-*-* 00/%lld:00:00", static_cast<long long>(n));
  if (every.unit == 2 && n == 1) return "*-*-* 00:00:00";
  return std::nullopt;
}

ScheduleUnitFiles scheduleUnits(const ScheduleEvery& every, const std::string& program) {
  ScheduleUnitFiles units;
  units.service =
      "[Unit]\n"
      "Description=Sync contacts and calendars with the other computers of the account\n"
      "\n"
      "[Service]\n"
      "Type=oneshot\n"
      "ExecStart=" +
      jobs::commandLine({program, "--sync", "--periodic"}) + "\n";
  std::string when;
  if (auto calendar = calendarOf(every))
    when = "OnCalendar=" + *calendar + "\nPersistent=true\n";
  else
    when = "OnStartupSec=2min\nOnUnitActiveSec=" + std::to_string(secondsOf(every)) + "s\n";
  units.timer =
      "[Unit]\n"
      "Description=Sync contacts and calendars " +
      cadenceOf(every) +
      "\n"
      "\n"
      "[Timer]\n" +
      when + "Unit=" + kScheduleUnit +
      ".service\n"
      "\n"
      "[Install]\n"
      "WantedBy=default.target\n";
  return units;
}

Date nextRun(const ScheduleEvery& every, Date now, std::optional<Date> lastAttempt) {
  const int64_t seconds = secondsOf(every);
  if (!calendarOf(every)) {
    if (!lastAttempt) return now;
    const Date next = *lastAttempt + std::chrono::seconds(seconds);
    return next < now ? now : next;
  }
  // On the clock: the next multiple of the interval since local midnight.
  const std::time_t t = std::chrono::system_clock::to_time_t(now);
  std::tm tm{};
  localtime_r(&t, &tm);
  const int64_t sinceMidnight = tm.tm_hour * 3600 + tm.tm_min * 60 + tm.tm_sec;
  const int64_t next = (sinceMidnight / seconds + 1) * seconds;
  const auto whole = std::chrono::system_clock::from_time_t(t);
  return std::chrono::time_point_cast<Date::duration>(whole +
                                                      std::chrono::seconds(next - sinceMidnight));
}

bool installSchedule(const ScheduleEvery& every) {
  const ScheduleUnitFiles units = scheduleUnits(every, thisProgram());
  paths::makeDirectories(jobs::unitsFolder(), 0755);
  if (!fs::writeFileAtomically(unitPath(".service"), units.service) ||
      !fs::writeFileAtomically(unitPath(".timer"), units.timer))
    throw SyncFailure(FailureKind::Other,
                      "The schedule's units could not be written in " + jobs::unitsFolder() + ".");
  auto& store = prefs::PreferenceStore::shared();
  store.setValue(kScheduleKey, Value(textOfEvery(every)), kVantorDefaultsKey,
                 prefs::Scope::CurrentHost);
  store.synchronize(kVantorDefaultsKey, prefs::Scope::CurrentHost);
  if (jobs::systemctl({"daemon-reload"}).status != 0) return false;
  // restart: a timer already running takes the new interval at once.
  return jobs::systemctl({"enable", std::string(kScheduleUnit) + ".timer"}).status == 0 &&
         jobs::systemctl({"restart", std::string(kScheduleUnit) + ".timer"}).status == 0;
}

void removeSchedule() {
  jobs::systemctl({"disable", "--now", std::string(kScheduleUnit) + ".timer"});
  std::error_code ignored;
  std::filesystem::remove(unitPath(".timer"), ignored);
  std::filesystem::remove(unitPath(".service"), ignored);
  jobs::systemctl({"daemon-reload"});
  auto& store = prefs::PreferenceStore::shared();
  store.setValue(kScheduleKey, Value(), kVantorDefaultsKey, prefs::Scope::CurrentHost);
  store.synchronize(kVantorDefaultsKey, prefs::Scope::CurrentHost);
}

std::optional<ScheduleEvery> installedSchedule() {
  if (!std::filesystem::exists(unitPath(".timer"))) return std::nullopt;
  const Value every = prefs::PreferenceStore::shared().copyValue(kScheduleKey, kVantorDefaultsKey,
                                                                 prefs::Scope::CurrentHost);
  if (!every.isString()) return std::nullopt;
  try {
    return ScheduleEvery::parse(every.string());
  } catch (const SyncFailure&) {
    return std::nullopt;  // edited by hand into something else: off
  }
}

}  // namespace vtc::client
