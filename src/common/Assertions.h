// Reporting a failed assertion through the one handler: the caller's file,
// line and function go into the Error line.
#pragma once

#include <string>

#include "VantorSyncManager/AssertionHandler.h"

namespace vtc {

// Logs the failure, then throws AssertionFailure or returns, by policy.
void handleAssertionFailure(const char* className, const char* member, const char* file, int line,
                            const char* function, const std::string& description);

}  // namespace vtc

#define VTC_ASSERTION_FAILURE(className, member, description)                                   \
  ::vtc::handleAssertionFailure((className), (member), __FILE__, __LINE__, __PRETTY_FUNCTION__, \
                                (description))
