// Lookup of installed applications through XDG desktop entries.
#pragma once

#include <optional>
#include <string>
#include <string_view>

namespace vtc::workspace {

// Whether an application of this bundle name ("Ticketer.app") is installed:
// a desktop entry "<name without .app>.desktop" in an XDG applications folder.
bool applicationInstalled(std::string_view bundleName);

// The folder of the application with this bundle identifier: the "Path="
// (working folder) of the desktop entry "<identifier>.desktop" found first
// in the XDG applications folders; none without such an entry or key.
std::optional<std::string> applicationPath(std::string_view bundleIdentifier);

}  // namespace vtc::workspace
