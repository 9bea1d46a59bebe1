#include "platform/bus/DistributedNotifications.h"

#include <systemd/sd-bus.h>

#include "common/Logging.h"
#include "platform/plist/PlistCodec.h"

namespace vtc::bus {

bool postDistributedNotification(const std::string& name, const std::string& object,
                                 const Dictionary& information) {
  // A bus connection per post: posts are rare, and a connection must not be
  // shared across fork().
  sd_bus* bus = nullptr;
  int r = sd_bus_open_user(&bus);
  if (r < 0) {
    VTC_LOG_DEBUG("No session bus for notification %@ (%d)", name, r);
    return false;
  }
  std::string info = information.empty() ? std::string() : plist::toXml(Value(information));
  r = sd_bus_emit_signal(bus, kNotificationPath, kNotificationInterface, kNotificationMember, "sss",
                         name.c_str(), object.c_str(), info.c_str());
  if (r >= 0) r = sd_bus_flush(bus);
  sd_bus_flush_close_unref(bus);
  if (r < 0) VTC_LOG_DEBUG("Notification %@ not delivered (%d)", name, r);
  return r >= 0;
}

}  // namespace vtc::bus
