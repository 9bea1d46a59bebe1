#include "platform/jobs/UnitFiles.h"

#include <ctime>
#include <sstream>

#include "common/Format.h"
#include "platform/fs/LocalPaths.h"

namespace vtc::jobs {

namespace {

constexpr const char* kGraphicalSession = "graphical-session.target";

struct CalendarField {
  const char* key;
  int low, high;
};
constexpr CalendarField kFields[] = {
    {"Minute", 0, 59}, {"Hour", 0, 23}, {"Day", 1, 31}, {"Weekday", 0, 7}, {"Month", 1, 12}};

// The value of a calendar key, -1 when absent; false when out of range.
bool fieldValue(const Dictionary& calendar, const CalendarField& field, int& value) {
  value = -1;
  const Value* v = calendar.find(field.key);
  if (!v) return true;
  const int64_t n = v->integer();
  if (n < field.low || n > field.high) return false;
  value = static_cast<int>(n);
  return true;
}

std::string twoDigits(int n) {
  return n < 0 ? "*" : format("%02d", n);
}

// Specifiers ("%n") are expanded in every setting; a literal percent sign
// is doubled.
std::string escapeSpecifiers(const std::string& text) {
  std::string out;
  for (char c : text) {
    if (c == '%') out += c;
    out += c;
  }
  return out;
}

// Arguments after the program also expand variables ("$X"): a literal
// dollar sign is doubled there, not in the program's path.
std::string quotedArgument(const std::string& argument, bool program) {
  std::string escaped;
  for (char c : escapeSpecifiers(argument)) {
    if (c == '$' && !program) escaped += c;
    escaped += c;
  }
  const bool plain = !escaped.empty() && escaped.find_first_of(" \t\"'\\;") == std::string::npos;
  if (plain) return escaped;
  std::string out = "\"";
  for (char c : escaped) {
    if (c == '"' || c == '\\') out += '\\';
    out += c;
  }
  return out + "\"";
}

bool validLabel(const std::string& label) {
  if (label.empty() || label.size() > 240) return false;
  for (char c : label)
    if (!std::isalnum(static_cast<unsigned char>(c)) && c != '.' && c != '-' && c != '_' &&
        c != ':')
      return false;
  return true;
}

// The [Unit] lines shared by every unit of a job.
std::string unitSection(const std::string& label, bool graphical) {
  std::string s = "# Made from the job description \"" + label +
                  "\"; rewritten and removed with it.\n[Unit]\nDescription=" + label + "\n";
  if (graphical)
    s += std::string("PartOf=") + kGraphicalSession + "\nAfter=" + kGraphicalSession + "\n";
  return s;
}

std::string installSection(bool graphical, const char* otherwise) {
  return std::string("\n[Install]\nWantedBy=") + (graphical ? kGraphicalSession : otherwise) + "\n";
}

}  // namespace

std::string unitsFolder() {
  return paths::join(paths::configDirectory(), "systemd/user");
}

std::vector<std::string> unitNames(const std::string& label) {
  return {label + ".service", label + ".timer", label + ".path"};
}

std::string commandLine(const std::vector<std::string>& arguments) {
  std::string line;
  for (const std::string& a : arguments) {
    if (!line.empty()) line += ' ';
    line += quotedArgument(a, line.empty());
  }
  return line;
}

std::optional<std::string> onCalendar(const Dictionary& calendar) {
  int minute, hour, day, weekday, month;
  int* values[] = {&minute, &hour, &day, &weekday, &month};
  for (size_t i = 0; i < std::size(kFields); ++i)
    if (!fieldValue(calendar, kFields[i], *values[i])) return std::nullopt;
  static const char* const kDays[] = {"Sun", "Mon", "Tue", "Wed", "Thu", "Fri", "Sat", "Sun"};
  std::string expression = weekday < 0 ? "" : std::string(kDays[weekday]) + " ";
  return expression + "*-" + twoDigits(month) + "-" + twoDigits(day) + " " + twoDigits(hour) + ":" +
         twoDigits(minute) + ":00";
}

std::optional<Date> nextCalendarDate(const Dictionary& calendar, Date after) {
  int minute, hour, day, weekday, month;
  int* values[] = {&minute, &hour, &day, &weekday, &month};
  for (size_t i = 0; i < std::size(kFields); ++i)
    if (!fieldValue(calendar, kFields[i], *values[i])) return std::nullopt;
  if (weekday == 7) weekday = 0;
  const std::time_t start = std::chrono::system_clock::to_time_t(after);
  std::tm today{};
  localtime_r(&start, &today);
  for (int d = 0; d < 400; ++d) {
    std::tm date = today;
    date.tm_mday += d;
    date.tm_hour = 12;  // noon: a day that exists whatever the clock change
    date.tm_min = date.tm_sec = 0;
    date.tm_isdst = -1;
    if (std::mktime(&date) < 0) return std::nullopt;
    if ((month >= 0 && date.tm_mon + 1 != month) || (day >= 0 && date.tm_mday != day) ||
        (weekday >= 0 && date.tm_wday != weekday))
      continue;
    for (int h = hour < 0 ? 0 : hour; h <= (hour < 0 ? 23 : hour); ++h) {
      for (int m = minute < 0 ? 0 : minute; m <= (minute < 0 ? 59 : minute); ++m) {
        std::tm t = date;
        t.tm_hour = h;
        t.tm_min = m;
        t.tm_isdst = -1;
        const std::time_t when = std::mktime(&t);
        // A time that the clock change skips comes back normalised to
        // another hour: not a match.
        if (when <= start || t.tm_hour != h || t.tm_min != m) continue;
        return std::chrono::system_clock::from_time_t(when);
      }
    }
  }
  return std::nullopt;
}

std::optional<JobUnits> unitsForJob(const Dictionary& description, std::string& error) {
  const std::string label = description.get("Label").string();
  if (!validLabel(label)) {
    error = "the label \"" + label + "\" cannot name a systemd unit";
    return std::nullopt;
  }
  std::vector<std::string> arguments;
  for (const Value& a : description.get("ProgramArguments").array()) arguments.push_back(textOf(a));
  if (arguments.empty() || arguments.front().empty()) {
    error = "the job " + label + " has no ProgramArguments";
    return std::nullopt;
  }
  const bool graphical = description.get("LimitLoadToSessionType").string() == "Glaze";
  const bool keepAlive = description.get("KeepAlive").boolean();
  const bool runAtLoad = description.get("RunAtLoad").boolean();
  const int64_t throttle = description.get("ThrottleInterval").integer();
  const std::string service = label + ".service";

  JobUnits units;
  std::ostringstream s;
  s << unitSection(label, graphical) << "\n[Service]\n";
  if (keepAlive)
    s << "Type=simple\nRestart=always\nRestartSec=" << (throttle > 0 ? throttle : 10) << "\n";
  else
    s << "Type=oneshot\n";
  s << "ExecStart=" << commandLine(arguments) << "\n";
  if (runAtLoad) s << installSection(graphical, "default.target");
  units.files.push_back({service, s.str()});
  if (runAtLoad) units.enabled.push_back(service);

  const Value* calendar = description.find("StartCalendarInterval");
  const int64_t interval = description.get("StartInterval").integer();
  if ((calendar && calendar->isDictionary()) || interval > 0) {
    std::ostringstream t;
    t << unitSection(label, graphical) << "\n[Timer]\n";
    if (calendar && calendar->isDictionary()) {
      std::optional<std::string> when = onCalendar(calendar->dictionary());
      if (!when) {
        error = "the calendar " + calendar->description() + " of " + label + " is out of range";
        return std::nullopt;
      }
      t << "OnCalendar=" << *when << "\nPersistent=true\n";
    }
    if (interval > 0) t << "OnActiveSec=" << interval << "\nOnUnitActiveSec=" << interval << "\n";
    t << "Unit=" << service << "\n" << installSection(graphical, "timers.target");
    units.files.push_back({label + ".timer", t.str()});
    units.enabled.push_back(label + ".timer");
  }

  const Array& watched = description.get("WatchPaths").array();
  if (!watched.empty()) {
    std::ostringstream p;
    p << unitSection(label, graphical) << "\n[Path]\n";
    for (const Value& path : watched) p << "PathChanged=" << escapeSpecifiers(textOf(path)) << "\n";
    // A path unit that triggers more often than its limit stops watching
    // (it fails rather than waits), so the limit is the throttle interval
    // with room for a few quick saves in a row, not one start per interval.
    if (throttle > 0) p << "TriggerLimitIntervalSec=" << throttle << "s\nTriggerLimitBurst=10\n";
    p << "Unit=" << service << "\n" << installSection(graphical, "paths.target");
    units.files.push_back({label + ".path", p.str()});
    units.enabled.push_back(label + ".path");
  }
  return units;
}

}  // namespace vtc::jobs
