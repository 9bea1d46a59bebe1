// An older configuration class kept for its callers; every operation is
// inert and answers a fixed value.
#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "VantorSyncManager/Export.h"
#include "VantorSyncManager/Value.h"

class VSM_EXPORT VTCConfiguration {
 public:
  VTCConfiguration() = default;
  // initWithClient:forVersion: and initWithClient:forVersion:forceNewConfig:
  VTCConfiguration(const std::string& client, int32_t version);
  VTCConfiguration(const std::string& client, int32_t version, bool forceNewConfig);

  static std::optional<VTCConfiguration> configurationForVersion(int32_t version);
  std::optional<vtc::Dictionary> downloadConfigurationDictionaryWithVersion(int32_t version);
  std::optional<vtc::Dictionary> dictionary();
  int32_t minClientBuildVersionForClientType(const std::string& clientType);
  std::optional<std::string> dynamicUIURL();
  std::optional<vtc::Dictionary> dataclassSyncIntervals();
  int32_t maxSyncsPerHour() { return -1; }
  int32_t defaultSyncInterval() { return 900; }
  bool isValid() { return true; }

 protected:
  // Kept for the layout older callers know; nothing reads them.
  int32_t _configVersion = 0;
  bool _validConfig = false;
  std::optional<vtc::Dictionary> _properties;
  std::string _client;
};
