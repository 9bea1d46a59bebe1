// The library's resources (the client description, job templates): files
// installed under the library's prefix, in <prefix>/share/VantorSyncManager,
// found relative to the loaded library; and its programs, in <prefix>/bin.
#pragma once

#include <optional>
#include <string>

namespace vtc::bundle {

inline constexpr const char* kBundleIdentifier = "com.korvo.VantorSyncManager";

// The path of resource "<name>.<type>", or none when it is not installed.
// A library that runs from its build tree finds the resources of its
// source tree.
std::optional<std::string> pathForResource(const std::string& name, const std::string& type);

// The path of the bundle's program `name` (nubilosyncclient): beside the
// program the library is linked into, else in <prefix>/bin; a library that
// runs from its build tree finds the program built beside it. None when it
// is nowhere.
std::optional<std::string> pathForTool(const std::string& name);

}  // namespace vtc::bundle
