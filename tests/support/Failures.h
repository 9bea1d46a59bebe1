// Matchers for the library's failures, which callers tell apart by name.
#pragma once

#include <gmock/gmock.h>

#include <string>

#include "VantorSyncManager/NubiloException.h"

namespace vtc::test {

// A NubiloException whose name() is this failure name.
inline testing::Matcher<const NubiloException&> IsFailure(const std::string& name) {
  return testing::Property("name", &NubiloException::name, name);
}

// For EXPECT_THAT on a callable: it throws a NubiloException of this name.
inline auto ThrowsFailure(const std::string& name) {
  return testing::Throws<NubiloException>(IsFailure(name));
}

}  // namespace vtc::test
