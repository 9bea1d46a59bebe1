// Questions other programs ask without opening a session: this library's
// client record in the sync engine, the client configuration, and whether
// the sync client runs or a sync involving this client is in progress.
// Callable from any thread; none of them raises for what it catches.
#pragma once

#include <cstdint>
#include <memory>
#include <string>

#include "VantorSyncManager/Export.h"
#include "VantorSyncManager/Value.h"

// The sync engine's record of one client: its description and its settings
// by key.
class VSM_EXPORT SyncEngineClientRecord {
 public:
  SyncEngineClientRecord(std::string identifier, vtc::Dictionary description);
  const std::string& clientIdentifier() const { return identifier_; }
  const vtc::Dictionary& description() const { return description_; }
  // The setting, or none; raises what the engine raises.
  vtc::Value objectForKey(const std::string& key) const;
  void setObject(const vtc::Value& value, const std::string& key);

 private:
  std::string identifier_;
  vtc::Dictionary description_;
};

// This library's client record ("com.korvo.VantorSync", registered with the
// installed "NBSC-ClientDescription" resource), or none with an Error line.
VSM_EXPORT std::shared_ptr<SyncEngineClientRecord> getNubiloClient();
// The older name of getNubiloClient.
VSM_EXPORT std::shared_ptr<SyncEngineClientRecord> getVantorClient();
// A copy of the client configuration.
VSM_EXPORT vtc::Dictionary getVanterConfiguration();

extern "C" {
// Whether the process named in ".owner.pid" of the support folder is alive.
VSM_EXPORT bool NubiloIsRunning(void);
// Whether a sync plan involving this client runs, or NubiloIsRunning.
VSM_EXPORT bool NubiloCurrentlySyncing(void);
// Whether a process exists (one of another user counts).
VSM_EXPORT bool isProcessRunning(int32_t pid);
}
