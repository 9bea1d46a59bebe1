// Notifications on a private session bus and passwords in a real Secret
// Service, with and without the daemons.
#include <gtest/gtest.h>

#include <cstdlib>

#include "platform/bus/DistributedNotifications.h"
#include "platform/plist/PlistCodec.h"
#include "platform/secrets/CredentialStore.h"
#include "support/SessionBus.h"

namespace {

TEST(DistributedNotifications, ReachListenersOnTheSessionBusAndFailQuietlyWithoutOne) {
  vtc::test::SessionBus bus;
  vtc::test::NotificationListener listener;
  ASSERT_TRUE(vtc::bus::postDistributedNotification("com.korvo.VantorSync.lastSyncDateChanged"));
  ASSERT_TRUE(vtc::bus::postDistributedNotification("NubiloSyncProgressNotification", "Contacts",
                                                    vtc::Dictionary{{"NubiloSyncProgressKey", 0}}));
  std::vector<vtc::test::NotificationListener::Received> got;
  for (int i = 0; i < 50 && got.size() < 2; ++i)  // up to 10 s on a busy machine
    for (auto& r : listener.waitFor(std::chrono::milliseconds(200))) got.push_back(r);
  ASSERT_EQ(got.size(), 2u);
  EXPECT_EQ(got[0].name, "com.korvo.VantorSync.lastSyncDateChanged");
  EXPECT_EQ(got[0].object, "");
  EXPECT_EQ(got[0].information, "");
  EXPECT_EQ(got[1].object, "Contacts");
  auto info = vtc::plist::parse(vtc::ByteView(
      reinterpret_cast<const uint8_t*>(got[1].information.data()), got[1].information.size()));
  ASSERT_TRUE(info);
  EXPECT_EQ(info->dictionary().get("NubiloSyncProgressKey").integer(), 0);

  // With no bus to reach, posting fails without throwing (the SessionBus puts
  // the address back when it goes).
  ::setenv("DBUS_SESSION_BUS_ADDRESS", "unix:path=/nonexistent/bus", 1);
  EXPECT_FALSE(vtc::bus::postDistributedNotification("anything"));
}

TEST(CredentialStore, FindsWhatTheSecretServiceHolds) {
  vtc::test::SessionBus bus;
  bus.startKeyring();
  std::string why;
  EXPECT_FALSE(vtc::secrets::findGenericPassword("Kitbag", "alice", &why));
  ASSERT_TRUE(vtc::secrets::storeGenericPassword("Kitbag", "alice", "Nubilo", "s3cr3t", &why))
      << why;
  EXPECT_EQ(vtc::secrets::findGenericPassword("Kitbag", "alice"), "s3cr3t");
  EXPECT_FALSE(vtc::secrets::findGenericPassword("Kitbag", "bob"));
  EXPECT_FALSE(vtc::secrets::findGenericPassword("Other", "alice"));
}

TEST(CredentialStore, WithoutASecretServiceThePasswordIsAbsentAndSaysWhy) {
  vtc::test::SessionBus bus;  // a bus, but no keyring on it
  std::string why;
  EXPECT_FALSE(vtc::secrets::findGenericPassword("Kitbag", "alice", &why));
  EXPECT_FALSE(why.empty());
}

}  // namespace
