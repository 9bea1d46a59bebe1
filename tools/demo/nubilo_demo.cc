// Starts a private WebDAV share on 127.0.0.1 and walks a sync session
// through it, printing each step.
#include <cstdio>
#include <exception>

#include "VantorSyncManager/VantorSyncManager.h"
#include "platform/dav/TesselSession.h"
#include "support/ApacheShare.h"

namespace {

void step(const char* what, const DavTransaction& t) {
  std::printf("  %-44s %s\n", what, t.description().c_str());
}

}  // namespace

int main() {
  try {
    vtc::test::ApacheShare share;
    std::printf("WebDAV share: http://127.0.0.1:%d/ (Apache pid %d, files in %s)\n", share.port(),
                static_cast<int>(share.pid()), share.documentRoot().c_str());

    vtc::Dictionary config = share.configuration();
    auto session = NubiloRemoteSession::sessionWithUsername("alice", "wonderland", config);
    std::printf("Session %s opened as alice\n", session->eventUUID().c_str());
    std::printf("  sync area        %s\n", session->syncPath().c_str());
    std::printf("  clients          %s\n", session->clientsPath().c_str());
    std::printf("  schemas          %s\n", session->schemasPath().c_str());
    std::printf("  responding server %s\n", session->respondingServer().value_or("-").c_str());

    TesselSession& dav = session->tesselSession();
    std::string dataclass = session->schemasPath() + "/com.korvo.Contacts";
    step("make the Contacts dataclass collection", dav.makeCollectionAtPath(dataclass, false));
    step("lock it", dav._lockResourceAtPath(dataclass + "/", 60, "<demo/>"));
    step("upload changelog 00000.clog",
         dav.putData({'d', 'e', 'm', 'o'}, dataclass + "/00000.clog"));
    step("record maxversion",
         dav._issuePropPatchAtPath(dataclass + "/", vtc::Dictionary{{"maxversion", "00000"}},
                                   session->syncNamespace()));
    DavTransaction list = dav.listCollectionAtPath(dataclass);
    step("list the dataclass", list);
    for (const auto& entry : list.result().array())
      std::printf("      %s (%lld bytes)\n", entry.dictionary().get(kNBURI).string().c_str(),
                  static_cast<long long>(entry.dictionary().get(kNBContentLength).integer()));
    step("unlock it", dav._unlockResourceAtPath(dataclass + "/"));
    session.reset();
    std::printf("Session released; share stopped.\n");
    return 0;
  } catch (const std::exception& e) {
    std::fprintf(stderr, "demo failed: %s\n", e.what());
    return 1;
  }
}
