// Sync reporting: a summary of one sync flattened into text values and
// stored on the share, where the account's other computers can read it.
#include <mutex>

#include "VantorSyncManager/HostIdentity.h"
#include "VantorSyncManager/NubiloRemoteSession.h"
#include "VantorSyncManager/StringAdditions.h"
#include "common/Logging.h"
#include "platform/dav/TesselSession.h"
#include "platform/os/HostIdentity.h"
#include "session/SyncReport.h"

namespace {

std::mutex gHostUUIDMutex;
std::optional<std::string> gHostUUID;  // kept once found; a failure is asked again

}  // namespace

std::optional<std::string> getHostUUIDString() {
  {
    std::lock_guard<std::mutex> lock(gHostUUIDMutex);
    if (gHostUUID) return gHostUUID;
  }
  int error = 0;
  std::optional<std::string> uuid = vtc::os::hostUUID(error);
  if (!uuid) {
    VTC_LOG_WARNING("getHostUUIDString: unable to determine UUID for host. Error: %d", error);
    return std::nullopt;
  }
  std::lock_guard<std::mutex> lock(gHostUUIDMutex);
  gHostUUID = uuid;
  return uuid;
}

namespace vtc {

Dictionary flattenedSyncReport(const Dictionary& summary,
                               const std::optional<std::string>& respondingServer,
                               const std::optional<std::string>& machineGUID) {
  vtc::Dictionary report{{"appName", "Granite"}, {"Version", "1"}, {"SyncStatus:code", "0"}};
  if (const vtc::Value* type = summary.find("SyncType"))
    report.set("SyncStatus:syncType", vtc::Value(vtc::textOf(*type)));
  if (const vtc::Value* duration = summary.find("GlobalSyncDuration"))
    report.set("SyncStatus:duration", vtc::Value(vtc::textOf(*duration)));
  if (respondingServer) report.set("RespondingServer", vtc::Value(*respondingServer));
  if (machineGUID) report.set("MachineGUID", vtc::Value(*machineGUID));

  // Per dataclass: the input key names the dataclass; only dictionaries count.
  static constexpr std::pair<const char*, const char*> kFields[] = {
      {"SyncDuration", "duration"}, {"SyncStart", "startTime"}, {"SyncEnd", "endTime"},
      {"ClogCount", "clogCount"},   {"SyncMode", "syncMode"},
  };
  for (const auto& [dataclass, entry] : summary) {
    if (!entry.isDictionary()) continue;
    const std::string prefix = dataclass + ":";
    for (const auto& [in, out] : kFields)
      if (const vtc::Value* v = entry.dictionary().find(in))
        report.set(prefix + out, vtc::Value(vtc::textOf(*v)));
    const vtc::Value* error = entry.dictionary().find("Error");
    report.set(prefix + "code", vtc::Value(error ? vtc::textOf(*error) : "0"));
  }
  return report;
}

std::string reportsPathIn(const std::string& syncPath) {
  return stringByAppendingTesselPathComponent(syncPath, "Reports");
}

void forgetHostUUIDForTesting() {
  std::lock_guard<std::mutex> lock(gHostUUIDMutex);
  gHostUUID.reset();
}

}  // namespace vtc

void NubiloRemoteSession::sendReportingInfo(const vtc::Dictionary& summary) {
  const std::optional<std::string> machine = getHostUUIDString();
  vtc::Dictionary report = vtc::flattenedSyncReport(summary, _respondingServer, machine);
  // The outcome is not looked at: a report that does not arrive costs only
  // the other computers' view of this sync.
  _TesselSession->_sendReportingInfo(report, vtc::reportsPathIn(_syncPath),
                                     machine.value_or(_configuration.get("guid").string()));
}
