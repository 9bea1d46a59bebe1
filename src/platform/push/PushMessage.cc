#include "platform/push/PushMessage.h"

#include "common/Limits.h"
#include "platform/plist/PlistCodec.h"

namespace vtc::push {

namespace {
constexpr const char* kGuidKey = "guid";
}  // namespace

std::optional<PushMessage> decodePushMessage(ByteView payload) {
  const uint64_t most = limits().pushMessageBytes;
  if (payload.size() > most) return std::nullopt;
  // Memory for the values: a small multiple of a small message.
  plist::ReadBudget budget{16 * most};
  const std::optional<Value> body = plist::parse(payload, &budget);
  if (!body || !body->isDictionary()) return std::nullopt;
  const Value& guid = body->dictionary().get(kGuidKey);
  return PushMessage{guid.isString() ? guid.string() : std::string()};
}

Value commitAnnouncement(const std::string& guid) {
  return Value(Dictionary{{kGuidKey, Value(guid)}});
}

}  // namespace vtc::push
