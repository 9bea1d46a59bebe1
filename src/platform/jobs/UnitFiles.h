// systemd user units made from a job description dictionary (the keys of
// the job description files: "Label", "ProgramArguments",
// "StartCalendarInterval", "StartInterval", "WatchPaths", "RunAtLoad",
// "KeepAlive", "ThrottleInterval", "LimitLoadToSessionType"). Pure text work:
// nothing here touches the disk or the user manager.
#pragma once

#include <optional>
#include <string>
#include <vector>

#include "VantorSyncManager/Value.h"

namespace vtc::jobs {

struct UnitFile {
  std::string name;  // "<label>.service", ".timer" or ".path"
  std::string text;
};

struct JobUnits {
  std::vector<UnitFile> files;
  // The units to enable: the service when it runs at load, the timer and
  // the path unit when there are.
  std::vector<std::string> enabled;
};

// The units of a description; none, with a sentence in error, when the
// description lacks a usable label or program, or holds a calendar entry
// out of range.
std::optional<JobUnits> unitsForJob(const Dictionary& description, std::string& error);

// The names of every unit a label can have, whether or not they exist.
std::vector<std::string> unitNames(const std::string& label);

// The OnCalendar= expression of a calendar dictionary ("Minute", "Hour",
// "Day", "Weekday" with 0 and 7 for Sunday, "Month"; an absent key matches
// every value), or none when a value is out of range.
std::optional<std::string> onCalendar(const Dictionary& calendar);

// The first local time after `after` that the calendar dictionary matches
// (whole minutes), or none when it matches nothing within a year and a bit.
std::optional<Date> nextCalendarDate(const Dictionary& calendar, Date after);

// An ExecStart= command line: each argument quoted where systemd needs it,
// "%" (and "$" after the program) escaped so that they reach the program as
// written.
std::string commandLine(const std::vector<std::string>& arguments);

// $XDG_CONFIG_HOME/systemd/user, where the units are written.
std::string unitsFolder();

}  // namespace vtc::jobs
