#include "VantorSyncManager/VTCConfiguration.h"

// The arguments are ignored: the class no longer configures anything.
VTCConfiguration::VTCConfiguration(const std::string&, int32_t) {}
VTCConfiguration::VTCConfiguration(const std::string&, int32_t, bool) {}

std::optional<VTCConfiguration> VTCConfiguration::configurationForVersion(int32_t) {
  return std::nullopt;
}

std::optional<vtc::Dictionary> VTCConfiguration::downloadConfigurationDictionaryWithVersion(
    int32_t) {
  return std::nullopt;
}

std::optional<vtc::Dictionary> VTCConfiguration::dictionary() {
  return std::nullopt;
}

int32_t VTCConfiguration::minClientBuildVersionForClientType(const std::string&) {
  return 0;
}

std::optional<std::string> VTCConfiguration::dynamicUIURL() {
  return std::nullopt;
}

std::optional<vtc::Dictionary> VTCConfiguration::dataclassSyncIntervals() {
  return std::nullopt;
}
