// The operating system's version, from /etc/os-release (VERSION_ID and
// BUILD_ID, or VERSION_CODENAME where a release has no build identifier).
#pragma once

#include <optional>
#include <string>

namespace vtc::os {

std::optional<std::string> productVersion();
std::optional<std::string> buildVersion();

// Reads another file instead of /etc/os-release; empty restores it (tests).
void setReleaseFileForTesting(std::string path);

}  // namespace vtc::os
