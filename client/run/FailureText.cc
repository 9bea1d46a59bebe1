#include "client/run/FailureText.h"

#include <regex>

#include "VantorSyncManager/PublicNames.h"
#include "common/Limits.h"

namespace vtc::client {

std::optional<int> httpStatusIn(const NubiloException& e) {
  static const std::regex status("HTTP ([1-5][0-9][0-9])");
  std::smatch m;
  const std::string& reason = e.reason();
  if (!std::regex_search(reason, m, status)) return std::nullopt;
  return std::stoi(m[1]);
}

bool showsDamage(const NubiloException& e) {
  // Too large for this computer is no damage: a repair would write the same.
  if (overLimitIn(e.reason())) return false;
  if (e.name() == NubiloCorruptChangelogException) return true;
  if (e.name() != NubiloFailedToDownloadChangelogException) return false;
  const auto status = httpStatusIn(e);
  return status && (*status == 404 || *status == 200);
}

namespace {

// Who holds the lock, since when and for how long at most, as the share's
// lock discovery tells it.
std::string lockSentence(const std::string& dataclass, const NubiloException& e) {
  const Array& held = e.userInfo().get("DAV:lockdiscovery").array();
  if (held.empty())
    return dataclass +
           " is locked by another computer that is syncing it; try again in a few "
           "minutes.";
  const Dictionary& lock = held.front().dictionary();
  std::string holder = lock.get("clientname").string();
  if (holder.empty()) holder = "another computer";
  std::string sentence = dataclass + " is locked by " + holder + ", which is syncing it";
  const std::string since = lock.get("acquiredate").string();
  if (!since.empty()) sentence += " (since " + since.substr(0, 19) + ")";
  static const std::regex seconds("^Second-([0-9]{1,9})$");
  std::smatch m;
  const std::string timeout = lock.get("timeout").string();
  if (std::regex_match(timeout, m, seconds)) {
    const long left = std::stol(m[1]);
    sentence += "; its lock ends within " +
                (left < 120 ? std::to_string(left) + " seconds"
                            : std::to_string((left + 59) / 60) + " minutes") +
                " at the latest, even if " + holder + " stopped";
  }
  return sentence + "; try again then.";
}

}  // namespace

std::string failureSentence(const std::string& dataclass, const NubiloException& e) {
  const auto status = httpStatusIn(e);
  const std::string answered = status ? " (HTTP " + std::to_string(*status) + ")" : "";
  const std::string& reason = e.reason();
  if (auto over = overLimitIn(reason))
    return "Syncing " + dataclass + " stopped: the share sent more than this computer accepts (" +
           (over->allowed.empty() ? "" : over->allowed + ", ") + "the limit " + over->key +
           "). If the share is trusted, raise " + over->key +
           " in ~/Library/Preferences/com.korvo.VantorSync.plist and sync again.";
  static const std::regex notWebDAV("was not WebDAV: ([^\">]*)");
  std::smatch m;
  if (std::regex_search(reason, m, notWebDAV))
    return "The server's answer while syncing " + dataclass +
           " was not WebDAV: " + std::string(m[1]) +
           "; check that the address is that of a WebDAV share.";
  if (reason.find("kNBTimeoutError") != std::string::npos) {
    static const std::regex within("within ([0-9]+) seconds");
    const std::string seconds =
        std::regex_search(reason, m, within) ? std::string(m[1]) + " seconds" : "its time-out";
    return "The server gave no complete answer within " + seconds + " while syncing " + dataclass +
           " (sync_dav_timeout_seconds); the next sync tries again.";
  }
  if (e.name() == NubiloNetworkFailureException)
    return "The server stopped answering while syncing " + dataclass +
           "; the next sync carries on from where this one stopped.";
  if (e.name() == NubiloLockFailureException) return lockSentence(dataclass, e);
  if (e.name() == NubiloTesselFullException)
    return "The share is full, so " + dataclass +
           " could not be sent; free some space on it and sync again.";
  if (e.name() == NubiloServerIncoherencyException)
    return "Another computer sent changes to " + dataclass +
           " at the same moment; the next sync takes them in first.";
  if (e.name() == NubiloAccountExpiredException)
    return "The account has expired; renew it to sync " + dataclass + ".";
  if (showsDamage(e))
    return "The share's copy of " + dataclass + " is damaged" + answered +
           "; run `nubilosyncclient repair " + dataclass +
           "` on a computer whose last sync of it succeeded.";
  return "The server answered with an error while syncing " + dataclass + answered +
         "; the next sync tries again.";
}

FailureKind failureKind(const NubiloException& e) {
  if (e.name() == NubiloNetworkFailureException) return FailureKind::Unreachable;
  if (e.name() == NubiloLoginFailureException) return FailureKind::Login;
  return FailureKind::Other;
}

}  // namespace vtc::client
