// Lookup of installed applications through XDG desktop entries.
#pragma once

#include <string_view>

namespace vtc::workspace {

// Whether an application of this bundle name ("Ticketer.app") is installed:
// a desktop entry "<name without .app>.desktop" in an XDG applications folder.
bool applicationInstalled(std::string_view bundleName);

}  // namespace vtc::workspace
