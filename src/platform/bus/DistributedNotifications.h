// Cross-process notifications: a D-Bus signal on the user's session bus that
// carries a name, an object and an information dictionary. Without a bus
// nothing is delivered and nothing fails.
#pragma once

#include <string>

#include "VantorSyncManager/Value.h"

namespace vtc::bus {

inline constexpr const char* kNotificationPath = "/com/korvo/VantorSync";
inline constexpr const char* kNotificationInterface = "com.korvo.VantorSync.Notifications";
inline constexpr const char* kNotificationMember = "Notification";

// Emits (name, object or "", information as an XML property list or "").
// D-Bus signals are delivered at once, so every notification is immediate.
// Returns whether the signal was sent.
bool postDistributedNotification(const std::string& name, const std::string& object = {},
                                 const Dictionary& information = {});

}  // namespace vtc::bus
