// The library's resources (the client description, job templates): files
// installed under the library's prefix, in <prefix>/share/VantorSyncManager,
// found relative to the loaded library.
#pragma once

#include <optional>
#include <string>

namespace vtc::bundle {

inline constexpr const char* kBundleIdentifier = "com.korvo.VantorSyncManager";

// The path of resource "<name>.<type>", or none when it is not installed.
// A library that runs from its build tree finds the resources of its
// source tree.
std::optional<std::string> pathForResource(const std::string& name, const std::string& type);

}  // namespace vtc::bundle
