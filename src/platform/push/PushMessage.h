// What a push message says: the guid of the computer that published it. The
// payload is a property-list dictionary (binary on the wire; XML is read
// too), decoded within the limits' push message cap; anything else says
// nothing.
#pragma once

#include <optional>
#include <string>

#include "VantorSyncManager/Value.h"

namespace vtc::push {

struct PushMessage {
  std::string guid;  // empty when the publisher gave none
};

// The message, or none for a payload over the cap or that is no property
// list dictionary.
std::optional<PushMessage> decodePushMessage(ByteView payload);

// The payload announcing a commit of the computer with this guid.
Value commitAnnouncement(const std::string& guid);

}  // namespace vtc::push
