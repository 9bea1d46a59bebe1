// Starts a private WebDAV share on 127.0.0.1 and walks two computers of one
// account through it, printing each step.
#include <cstdio>
#include <cstdlib>
#include <exception>
#include <string>

#include "VantorSyncManager/VantorSyncManager.h"
#include "common/Format.h"
#include "platform/dav/TesselSession.h"
#include "localshare/ApacheShare.h"

namespace {

std::unique_ptr<NubiloRemoteSession> openAs(vtc::local::ApacheShare& share, const char* guid,
                                            const char* name) {
  vtc::Dictionary config = share.configuration();
  config.set("guid", vtc::Value(guid));
  config.set("ClientGuid", vtc::Value(guid));
  config.set("ClientName", vtc::Value(name));
  config.set("max_lock_acquire_attempts", vtc::Value(0));
  auto session = NubiloRemoteSession::sessionWithUsername("alice", "wonderland", config);
  std::printf("%s opened session %s (responding server %s)\n", name,
              session->eventUUID().c_str(), session->respondingServer().value_or("-").c_str());
  return session;
}

void show(const char* what, const vtc::Dictionary& record) {
  std::printf("  %s:", what);
  for (const auto& [key, value] : record)
    std::printf(" %s=%s", key.c_str(), vtc::textOf(value).c_str());
  std::printf("\n");
}

}  // namespace

int main() {
  try {
    // The demo's own home: its preferences and log stay out of the user's.
    char home[] = "/tmp/nubilo-demo-XXXXXX";
    if (!mkdtemp(home)) return 1;
    ::setenv("HOME", home, 1);

    vtc::local::ApacheShare share;
    std::printf("WebDAV share http://127.0.0.1:%d/ (Apache pid %d, files in %s)\n\n",
                share.port(), static_cast<int>(share.pid()), share.documentRoot().c_str());

    auto laptop = openAs(share, "LAPTOP-0001", "Alice's Laptop");
    laptop->registerClient("LAPTOP-0001", "Alice's Laptop");
    auto desktop = openAs(share, "DESKTOP-0002", "Alice's Desktop");
    desktop->registerClient("DESKTOP-0002", "Alice's Desktop");
    std::printf("Registered clients:\n");
    for (const auto& client : laptop->getAllClientInfo()) show("client", client.dictionary());

    const std::string contacts = "com.korvo.Contacts";
    std::printf("\nThe laptop reads the Contacts record (registering the dataclass):\n");
    show("record", laptop->getDataclassInfo(contacts));

    std::printf("\nThe laptop locks Contacts and commits changelogs 00001 and 00002:\n");
    laptop->lockClient();
    laptop->lockDataclass(contacts);
    for (int i = 1; i <= 2; ++i)
      laptop->tesselSession().putData({'c', 'l', 'o', 'g'},
                                      laptop->changeLogPathForDataclass(contacts, i));
    laptop->setInfoForDataclass(vtc::Dictionary{{"minversion", "00001"}, {"maxversion", "00002"}},
                                contacts);
    show("record", laptop->getDataclassInfo(contacts));

    std::printf("\nThe desktop tries to lock Contacts while the laptop holds it:\n");
    try {
      desktop->lockDataclass(contacts);
    } catch (const NubiloException& e) {
      std::printf("  %s: %s\n", e.name().c_str(), e.reason().c_str());
      for (const auto& lock : e.userInfo().get("DAV:lockdiscovery").array())
        std::printf("  held by client %s (%s) since %s\n",
                    lock.dictionary().get("clientid").string().c_str(),
                    lock.dictionary().get("clientname").string().c_str(),
                    lock.dictionary().get("acquiredate").string().c_str());
    }

    std::printf("\nThe laptop resets Contacts; the desktop must fetch the whole truth:\n");
    laptop->resetDataclass(contacts);
    laptop->unlockDataclass(contacts);
    show("record", laptop->getDataclassInfo(contacts));
    show("desktop", laptop->getClientInfo("DESKTOP-0002"));

    std::printf("\nReleasing the laptop's session unlocks what it still holds (%zu resource).\n",
                laptop->lockedResources().size());
    laptop.reset();
    desktop->lockDataclass(contacts);
    std::printf("The desktop now locks Contacts at once.\n");
    desktop.reset();
    std::printf("\nDone; the share is stopped. Log: %s/Library/Logs/Sync/nubilosync.log\n", home);
    return 0;
  } catch (const std::exception& e) {
    std::fprintf(stderr, "demo failed: %s\n", e.what());
    return 1;
  }
}
