// setup tries the share before it stores anything: the two servers the sync
// runs on pass, nginx (no PROPPATCH) and a server that grants locks without
// enforcing them are refused with a sentence naming what they lack, exit
// status 7, and the probes of the checks are gone from the share afterwards.
#include <gmock/gmock.h>

#include <filesystem>
#include <set>

#include "localshare/Computer.h"
#include "localshare/NginxShare.h"
#include "localshare/SabreShare.h"
#include "support/ShareTest.h"
#include "support/TestHome.h"

using testing::HasSubstr;
using vtc::local::Computer;
using vtc::local::Share;

namespace {

Computer::Result setup(const Computer& c, const Share& share) {
  return c.run({"setup", share.url("/sync"), "--user", Share::kUser, "--password-command",
                std::string("printf ") + Share::kPassword});
}

// What is left in the sync area (the area itself may not exist).
std::set<std::string> syncArea(const Share& share) {
  return std::filesystem::exists(share.diskPath("/sync")) ? share.members("/sync")
                                                          : std::set<std::string>{};
}

class Qualification : public ::testing::TestWithParam<vtc::local::ShareKind> {
 protected:
  vtc::test::TestHome home;
  Computer mac{"Mac A"};
};
INSTANTIATE_TEST_SUITE_P(Servers, Qualification, vtc::test::kEachServer, vtc::test::serverName);

TEST_P(Qualification, TheServersTheSyncRunsOnPassAndKeepOnlyTheSyncArea) {
  auto share = vtc::local::startShare(GetParam());
  Computer::Result r = setup(mac, *share);
  EXPECT_EQ(r.status, 0) << r.err;
  EXPECT_EQ(syncArea(*share), (std::set<std::string>{"Clients/", "Schemas/"}));
  EXPECT_EQ(share->members("/sync/Clients").size(), 1u);  // this computer, not the check's
}

using Refusal = Qualification;

TEST_F(Refusal, NginxKeepsNoPropertiesAndIsRefusedBeforeAnythingIsStored) {
  vtc::local::NginxShare share;
  Computer::Result r = setup(mac, share);
  EXPECT_EQ(r.status, 7);
  EXPECT_THAT(r.err, HasSubstr("The server at " + share.url("/sync") +
                               " does not keep WebDAV properties (PROPPATCH answered 405); "
                               "syncing needs a WebDAV server with dead properties"));
  EXPECT_EQ(syncArea(share), (std::set<std::string>{"Clients/", "Schemas/"}));
  EXPECT_THAT(mac.run({"sync"}).err, HasSubstr("Syncing is not set up on this computer"));
}

TEST_F(Refusal, AServerThatGrantsLocksWithoutEnforcingThemIsRefused) {
  vtc::local::SabreShare share(vtc::local::SabreShare::Options{.enforceLocks = false});
  Computer::Result r = setup(mac, share);
  EXPECT_EQ(r.status, 7);
  EXPECT_THAT(r.err, HasSubstr("does not enforce its WebDAV locks: another client could write a "
                               "locked resource; syncing needs locks that keep other clients "
                               "out"));
  EXPECT_EQ(syncArea(share), (std::set<std::string>{"Clients/", "Schemas/"}));
}

}  // namespace
