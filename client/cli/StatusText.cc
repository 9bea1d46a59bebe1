#include "client/cli/StatusText.h"

#include <nlohmann/json.hpp>

#include <ctime>
#include <ostream>

#include "client/cli/TerminalText.h"
#include "client/items/ItemRecord.h"
#include "common/Format.h"

namespace vtc::client {

namespace {

std::string plural(int64_t n, const char* one, const char* many) {
  return std::to_string(n) + " " + (n == 1 ? one : many);
}

// "manual sync of 0.21 s, com.korvo.Contacts ok" from a flattened report.
std::string reportLine(const Dictionary& report) {
  std::string line = report.get("SyncStatus:syncType").string();
  if (line.empty())
    line = "sync";
  else
    line += " sync";
  if (const Value* d = report.find("SyncStatus:duration")) line += format(" of %.2f s", d->real());
  for (const auto& [key, value] : report) {
    if (!key.ends_with(":code") || key.starts_with("SyncStatus:")) continue;
    const std::string dataclass = key.substr(0, key.size() - 5);
    line += ", " + dataclass + (value.string() == "0" ? " ok" : " failed");
  }
  return shownSafely(line);
}

nlohmann::json optionalDate(const std::optional<Date>& date) {
  return date ? nlohmann::json(textOf(Value(*date))) : nlohmann::json(nullptr);
}

template <typename T>
nlohmann::json optional(const std::optional<T>& value) {
  return value ? nlohmann::json(*value) : nlohmann::json(nullptr);
}

nlohmann::json jsonOf(const Value& v) {
  switch (v.kind()) {
    case Value::Kind::String:
      return v.string();
    case Value::Kind::Integer:
      return v.integer();
    case Value::Kind::Real:
      return v.real();
    case Value::Kind::Boolean:
      return v.boolean();
    case Value::Kind::None:
      return nullptr;
    default:
      return textOf(v);
  }
}

}  // namespace

std::string localTime(const std::optional<Date>& date) {
  if (!date) return "never";
  std::time_t t = std::chrono::system_clock::to_time_t(*date);
  std::tm tm{};
  localtime_r(&t, &tm);
  char buf[64];
  std::strftime(buf, sizeof buf, "%Y-%m-%d %H:%M:%S", &tm);
  return buf;
}

std::string timeAgo(Date then, Date now) {
  const auto minutes = std::chrono::duration_cast<std::chrono::minutes>(now - then).count();
  auto count = [](long long n, const char* unit) {
    return std::to_string(n) + " " + unit + (n == 1 ? "" : "s") + " ago";
  };
  if (minutes < 1) return "just now";
  if (minutes < 60) return count(minutes, "minute");
  if (minutes < 48 * 60) return count(minutes / 60, "hour");
  return count(minutes / (24 * 60), "day");
}

void printStatus(const StatusReport& s, std::ostream& out) {
  if (!s.setUp) {
    out << "Syncing is not set up; run `nubilosyncclient setup URL --user NAME`.\n";
    return;
  }
  out << "This computer: " << s.computerName << " (" << s.computerGuid << ")\n"
      << "Account: " << s.member << " at " << s.server << "\n";
  out << (s.runningPid ? "A sync is running now (process " + std::to_string(*s.runningPid) + ").\n"
                       : std::string("No sync is running now.\n"));
  out << "Schedule: "
      << (s.scheduleOn ? s.cadence + ", next " + localTime(s.nextScheduledSync)
                       : std::string("off"))
      << "\nPush: " << (s.pushOn ? "on" : "off")
      << (s.pushServer.empty() ? "" : " (" + s.pushServer + ")") << "\n"
      << "Log: " << s.logFile << " (" << s.logLevel
      << "; raise it with `nubilosyncclient config set log-level info`)\n";
  if (s.dataclasses.empty())
    out << "No folder is synced; add one with `nubilosyncclient add contacts|calendars FOLDER`.\n";
  for (const DataclassStatus& d : s.dataclasses) {
    out << "\n"
        << d.name << " (" << d.kind << "): " << d.folder << "\n"
        << "  " << plural(d.items, "item", "items") << "; last sync " << localTime(d.lastSuccess)
        << "; last attempt " << localTime(d.lastAttempt) << "\n";
    if (d.failedCount > 0)
      out << "  " << plural(d.failedCount, "failed sync", "failed syncs")
          << " since: " << shownSafely(d.lastError.value_or("(no reason kept)")) << "\n";
    if (d.maxversion)
      out << "  on the share: changelogs " << d.minversion.value_or(1) << " to " << *d.maxversion
          << "\n";
    else if (!s.serverError)
      out << "  on the share: nothing yet\n";
    for (const std::string& line : d.leftOver) out << "  " << shownSafely(line) << "\n";
    if (d.serverStatus == std::optional<std::string>("needstruth"))
      out << "  this computer takes in the whole truth at its next sync (needstruth)\n";
  }
  if (!s.computers.empty()) {
    out << "\nComputers of the account:\n";
    for (const ComputerStatus& c : s.computers) {
      out << "  " << shownSafely(c.name) << (c.thisComputer ? " (this computer)" : "")
          << ": last sync " << shownSafely(c.lastSync.value_or("never"));
      if (!c.report.empty()) out << "; " << reportLine(c.report);
      out << "\n";
    }
  }
  if (!s.conflicts.empty())
    out << "\n"
        << plural(static_cast<int64_t>(s.conflicts.size()), "conflict", "conflicts")
        << " kept; see `nubilosyncclient conflicts`.\n";
}

std::string statusAsJson(const StatusReport& s) {
  nlohmann::json doc;
  doc["setUp"] = s.setUp;
  doc["computer"] = {{"name", s.computerName}, {"guid", s.computerGuid}};
  doc["account"] = {{"member", s.member}, {"server", s.server}};
  doc["running"] = s.runningPid ? nlohmann::json{{"pid", *s.runningPid}} : nlohmann::json(nullptr);
  doc["schedule"] = {
      {"on", s.scheduleOn}, {"cadence", s.cadence}, {"next", optionalDate(s.nextScheduledSync)}};
  doc["push"] = {{"on", s.pushOn}, {"server", s.pushServer}};
  doc["log"] = {{"file", s.logFile}, {"level", s.logLevel}};
  doc["dataclasses"] = nlohmann::json::array();
  for (const DataclassStatus& d : s.dataclasses)
    doc["dataclasses"].push_back({{"name", d.name},
                                  {"kind", d.kind},
                                  {"folder", d.folder},
                                  {"items", d.items},
                                  {"lastAttempt", optionalDate(d.lastAttempt)},
                                  {"lastSuccess", optionalDate(d.lastSuccess)},
                                  {"failedCount", d.failedCount},
                                  {"lastError", optional(d.lastError)},
                                  {"leftOver", d.leftOver},
                                  {"share",
                                   {{"minversion", optional(d.minversion)},
                                    {"maxversion", optional(d.maxversion)},
                                    {"status", optional(d.serverStatus)}}}});
  doc["computers"] = nlohmann::json::array();
  for (const ComputerStatus& c : s.computers) {
    nlohmann::json report = nlohmann::json::object();
    for (const auto& [key, value] : c.report) report[key] = jsonOf(value);
    doc["computers"].push_back({{"name", c.name},
                                {"guid", c.guid},
                                {"thisComputer", c.thisComputer},
                                {"lastSync", optional(c.lastSync)},
                                {"lastReport", report}});
  }
  doc["conflicts"] = nlohmann::json::array();
  for (const KeptConflict& c : s.conflicts)
    doc["conflicts"].push_back({{"id", c.id},
                                {"dataclass", c.dataclass},
                                {"record", c.record},
                                {"file", c.file},
                                {"name", c.name},
                                {"field", std::string(nameOf(c.field))},
                                {"key", c.field},
                                {"kept", jsonOf(c.kept)},
                                {"lost", jsonOf(c.lost)},
                                {"keptComputer", c.keptComputer},
                                {"lostComputer", c.lostComputer},
                                {"date", textOf(Value(c.date))}});
  doc["serverError"] = optional(s.serverError);
  // Text from the share is not always UTF-8: such bytes become U+FFFD.
  return doc.dump(2, ' ', false, nlohmann::json::error_handler_t::replace);
}

}  // namespace vtc::client
