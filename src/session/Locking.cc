// Lock, relock and unlock of one resource. Each request holds the monitor of
// the WebDAV session; sleeps, logs and exceptions happen outside it.
#include <cstdlib>
#include <ctime>
#include <mutex>

#include "VantorSyncManager/NubiloException.h"
#include "VantorSyncManager/NubiloRemoteSession.h"
#include "VantorSyncManager/PublicNames.h"
#include "common/Clock.h"
#include "common/Logging.h"
#include "platform/dav/TesselSession.h"

namespace {

constexpr double kMaxLockPause = 90.0;

std::string dateText(vtc::Date date) {
  std::time_t t = std::chrono::system_clock::to_time_t(date);
  std::tm tm{};
  localtime_r(&t, &tm);
  char buf[64];
  std::strftime(buf, sizeof buf, "%Y-%m-%d %H:%M:%S %z", &tm);
  return buf;
}

}  // namespace

std::string NubiloRemoteSession::lockOwnerText() const {
  // The template's last "%@" is the acquire date; names earlier in it may
  // hold any text, so it is replaced in place rather than formatted.
  std::string owner = _lockOwnerFormatString;
  size_t at = owner.rfind("%@");
  if (at != std::string::npos) owner.replace(at, 2, dateText(vtc::currentClock().now()));
  return owner;
}

void NubiloRemoteSession::_lockResourceAtPath(const std::string& path) {
  const std::string owner = lockOwnerText();
  double pause = 0;
  float factor = 0.15f;
  for (int64_t attempt = 0; attempt <= _maxLockAttempts; ++attempt) {
    DavTransaction t;
    {
      std::lock_guard<std::recursive_mutex> monitor(_TesselSession->monitor());
      t = _TesselSession->_lockResourceAtPath(path, static_cast<double>(_lockDuration), owner);
    }
    if (t.isSuccessful()) {
      _lockedResources.insert(path);
      return;
    }
    if (t.errorType() == kNBNetworkError) {
      VTC_LOG_WARNING("Lock transaction failed due to network error raising...");
      messageTraceTransactionFailure(t, true, attempt, "Failed to lock resource");
      throw NubiloException(NubiloNetworkFailureException,
                            vtc::format("Lock transaction failed due to network error, %@", t));
    }
    if (t.httpStatusCode() == 404) {
      VTC_LOG_WARNING("Lock transaction failed due to resource not found at %@", path);
      messageTraceTransactionFailure(t, true, attempt, "Failed to lock resource");
      throw NubiloException(
          NubiloResourceNotFoundException,
          vtc::format("Lock transaction failed due to resource not found at %@", path));
    }
    if (attempt < _maxLockAttempts) {
      // A random share of a doubling step, accumulated: contending clients
      // spread out, and no pause is ever shorter than the one before.
      double r = std::rand() / 2147483647.0;
      pause = std::min(
          pause + r * static_cast<double>(factor) * static_cast<double>(_lockAcquireSleepInterval),
          kMaxLockPause);
      VTC_LOG_WARNING("Lock attempt %d of %@ failed, retrying in %d seconds", attempt + 1, path,
                      static_cast<int>(pause));
      messageTraceTransactionFailure(t, attempt >= _maxLockAttempts, attempt,
                                     "Failed to lock resource");
      vtc::currentSleeper().sleepFor(vtc::Seconds(pause));
      factor *= 2;
    }
  }
  DavTransaction attributes = _TesselSession->extendedAttributesAtPath(path);
  VTC_LOG_WARNING("Failed to lock %@ after %d lock attempts, raising exception", path,
                  _maxLockAttempts);
  throw NubiloException(NubiloLockFailureException,
                        vtc::format("Failed to lock resource, %@", path),
                        attributes.result().dictionary());
}

void NubiloRemoteSession::_relockResourceAtPath(const std::string& path) {
  const std::string owner = lockOwnerText();
  DavTransaction t;
  {
    std::lock_guard<std::recursive_mutex> monitor(_TesselSession->monitor());
    t = _TesselSession->_relockResourceAtPath(path, static_cast<double>(_lockDuration), owner);
  }
  if (t.isSuccessful()) return;
  messageTraceTransactionFailure(t, true, 0, "Failed to relock resource");
  throw NubiloException(NubiloRelockFailureException,
                        vtc::format("Failed to relock resource, %@", path));
}

void NubiloRemoteSession::_unlockResourceAtPath(const std::string& path) {
  DavTransaction t;
  {
    std::lock_guard<std::recursive_mutex> monitor(_TesselSession->monitor());
    t = _TesselSession->unlockResourceAtPath(path);
    if (!t.isSuccessful()) {
      VTC_LOG_WARNING("Failed to unlock resource %@, retrying...", path);
      t = _TesselSession->unlockResourceAtPath(path);
    }
  }
  if (t.isSuccessful()) {
    _lockedResources.erase(path);
    return;
  }
  // Kept in _lockedResources: releasing the session tries once more.
  VTC_LOG_ERROR("Failed to unlock resource (lock not held), %@", path);
}
