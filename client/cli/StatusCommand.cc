// `status` and `conflicts`: what this computer syncs and how its syncs
// went, the computers of the account, and the kept losing values.
#include <ctime>
#include <ostream>

#include "VantorSyncManager/VTCPrefsCenter.h"
#include "client/cli/Commands.h"
#include "client/run/Account.h"
#include "client/run/Automation.h"
#include "client/run/ConflictStore.h"
#include "client/run/SyncFailure.h"
#include "common/Format.h"

namespace vtc::client {

namespace {

std::string when(const std::optional<Date>& date) {
  if (!date) return "never";
  std::time_t t = std::chrono::system_clock::to_time_t(*date);
  std::tm tm{};
  localtime_r(&t, &tm);
  char buf[64];
  std::strftime(buf, sizeof buf, "%Y-%m-%d %H:%M:%S", &tm);
  return buf;
}

// A field's lines on one line: folding undone, line ends dropped.
std::string shown(const Value& value) {
  if (value.isNone()) return "(cleared)";
  std::string text = textOf(value), out;
  for (size_t i = 0; i < text.size(); ++i) {
    if (text[i] == '\r') continue;
    if (text[i] == '\n') {
      if (i + 1 < text.size() && (text[i + 1] == ' ' || text[i + 1] == '\t'))
        ++i;  // a folded line goes on
      else if (i + 1 < text.size())
        out += " | ";
      continue;
    }
    out += text[i];
  }
  return out;
}

}  // namespace

int statusCommand(Output& output) {
  VTCPrefsCenter& prefs = VTCPrefsCenter::defaultCenter();
  std::ostream& out = output.out;
  if (!prefs.syncTurnedOn()) {
    out << "Syncing is not set up; run `nubilosyncclient setup URL --user NAME`.\n";
    return 0;
  }
  out << "This computer: " << prefs.clientName().value_or("?") << " ("
      << prefs.clientGuid().value_or("?") << ")\nAccount: " << prefs.username().value_or("?")
      << " at " << storedServerURL() << "\n";
  for (const Collection& c : configuredCollections()) {
    out << c.dataclass << " (" << kindWord(c.kind) << "): " << c.folder << "\n"
        << "  last sync " << when(prefs.lastSuccessfulSyncDateForDataclass(c.dataclass))
        << ", last attempt " << when(prefs.lastAttemptedSyncDateForDataclass(c.dataclass));
    if (int64_t failed = prefs.failedSyncCountForDataclass(c.dataclass))
      out << ", " << failed << " failed since";
    out << "\n";
  }
  const auto conflicts = ConflictStore().list();
  if (!conflicts.empty())
    out << conflicts.size() << " conflict" << (conflicts.size() == 1 ? "" : "s")
        << " kept; see `nubilosyncclient conflicts`.\n";

  const auto [member, password] = storedCredentials();
  auto session = openSession(member, password, prefs.configuration());
  out << "Computers of the account:\n";
  for (const Value& client : session->getAllClientInfo()) {
    const Dictionary& d = client.dictionary();
    out << "  " << d.get("clientname").string() << " (" << d.get("guid").string() << ")";
    if (const Value* last = d.find("lastsync")) out << ", last sync " << textOf(*last);
    out << "\n";
  }
  const AutomationState automation = automationState();
  out << "Schedule: "
      << (automation.scheduleOn
              ? automation.cadence + ", next " + when(automation.nextScheduledSync)
              : std::string("off"))
      << "\nPush: " << (automation.pushOn ? "on" : "off")
      << (automation.pushServer.empty() ? "" : " (" + automation.pushServer + ")") << "\n";
  return 0;
}

int conflictsCommand(Output& output) {
  const auto conflicts = ConflictStore().list();
  if (conflicts.empty()) {
    if (output.verbosity > 0) output.out << "No conflicts are kept.\n";
    return 0;
  }
  for (const KeptConflict& c : conflicts)
    output.out << c.id << "  " << c.dataclass << "  " << c.record << "  " << c.field << "\n"
               << "    kept: " << shown(c.kept) << "  (from " << c.keptComputer << ")\n"
               << "    lost: " << shown(c.lost) << "  (from " << c.lostComputer << ", "
               << when(c.date) << ")\n";
  return 0;
}

}  // namespace vtc::client
