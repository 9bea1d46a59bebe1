// The dataclass maintenance functions against a real share, with the account
// stored the way a user stores it: member name in the preferences, password
// in the Secret Service.
#include <gmock/gmock.h>

#include "VantorSyncManager/DataclassMaintenance.h"
#include "VantorSyncManager/NubiloRemoteSession.h"
#include "VantorSyncManager/PublicNames.h"
#include "VantorSyncManager/VTCPrefsCenter.h"
#include "platform/dav/TesselSession.h"
#include "platform/prefs/PreferenceStore.h"
#include "platform/secrets/CredentialStore.h"
#include "support/FaultProxy.h"
#include "support/SessionBus.h"
#include "support/SharePreferences.h"
#include "support/ShareTest.h"

using testing::ElementsAre;
using testing::StartsWith;
using testing::UnorderedElementsAre;

namespace {

class Maintenance : public vtc::test::ShareTest {
 protected:
  vtc::test::SessionBus bus;
  vtc::test::FaultProxy proxy{share.port()};

  void SetUp() override {
    vtc::test::storeShareInPreferences(share, proxy.port());
    VTCPrefsCenter::defaultCenter().setClientGuid("GUID-M");
  }
  // The account the functions open their sessions with.
  void storeAccount() {
    bus.startKeyring();
    ASSERT_TRUE(vtc::secrets::storeGenericPassword("Kitbag", "alice", "Nubilo", "wonderland"));
    vtc::prefs::PreferenceStore::shared().setValue("KitbagMember", vtc::Value("alice"),
                                                   kVantorDefaultsKey, vtc::prefs::Scope::AnyHost);
  }
  // The Error lines written by the function itself (the session may add its own).
  std::vector<std::string> errors(const std::string& ending) const {
    std::vector<std::string> out = logged.messages("Error");
    std::erase_if(out, [&](const std::string& m) { return !m.ends_with(ending); });
    return out;
  }
};

TEST_F(Maintenance, DataclassesAreRemovedEachInTurnAndOneFailedRemovalIsReported) {
  storeAccount();
  auto mine = openSession();  // straight to the share
  for (const char* dc : {"A", "B", "C"}) mine->getDataclassInfo(dc);
  mine->tesselSession().makeCollectionAtPath(mine->schemasPath() + "/Stray", false);
  EXPECT_THAT(*registeredDataclasses(),
              UnorderedElementsAre(vtc::Value("A"), vtc::Value("B"), vtc::Value("C"),
                                   vtc::Value()));  // the stray collection has no name

  size_t before = proxy.requests().size();
  EXPECT_TRUE(removeNubiloDataclasses({}));
  EXPECT_GT(proxy.requests().size(), before);  // a session was opened all the same

  proxy.answer({"DELETE", mine->schemasPath() + "/B", 0}, 500);
  EXPECT_FALSE(removeNubiloDataclasses({"A", "B", "C"}));
  EXPECT_THAT(logged.messages("Info"),
              testing::IsSupersetOf({"Unregistering dataclass:A", "Unregistering dataclass:B",
                                     "Unregistering dataclass:C"}));
  EXPECT_THAT(mine->dataclassNames(), UnorderedElementsAre("B", "Stray"));
  EXPECT_TRUE(errors("while trying to unregister dataclasses (A, B, C)").empty());
}

TEST_F(Maintenance, WithoutAStoredAccountEveryFunctionLogsAndGivesItsNeutralResult) {
  EXPECT_FALSE(removeNubiloDataclasses({"A", "B"}));
  EXPECT_EQ(errors("while trying to unregister dataclasses (A, B)"),
            std::vector<std::string>{"exception NubiloLoginFailureException: Failed to obtain "
                                     "credentials while trying to unregister dataclasses (A, B)"});
  EXPECT_FALSE(registeredDataclasses());
  EXPECT_EQ(errors("while trying to retrieve registered dataclasses").size(), 1u);
  EXPECT_FALSE(approximateStorageUsedByDataclass("A"));
  EXPECT_EQ(errors("while trying to retrieve storage consumed by dataclass A").size(), 1u);
  EXPECT_TRUE(proxy.requests().empty());

  // A recorded value needs no session.
  VTCPrefsCenter::defaultCenter().setStorageConsumed(vtc::Value(1234), "A");
  EXPECT_EQ(approximateStorageUsedByDataclass("A"), 1234);
  EXPECT_EQ(errors("by dataclass A").size(), 1u);
}

TEST_F(Maintenance, StorageIsWorkedOutOnceAndThenTakenFromThePreferences) {
  storeAccount();
  auto mine = openSession();  // straight to the share
  mine->getDataclassInfo("Contacts");
  mine->tesselSession().putData({'a', 'b', 'c'}, mine->changeLogPathForDataclass("Contacts", 1));
  mine->tesselSession().putData({'d', 'e', 'f', 'g'},
                                mine->changeLogPathForDataclass("Contacts", 2));
  EXPECT_EQ(approximateStorageUsedByDataclass("Contacts"), 7);
  EXPECT_EQ(VTCPrefsCenter::defaultCenter().storageConsumedForDataclass("Contacts").integer(), 7);
  EXPECT_EQ(logged.count("Info", "Recording 7 bytes consumed for dataclass Contacts"), 1u);

  mine->tesselSession().putData({'h'}, mine->changeLogPathForDataclass("Contacts", 3));
  size_t before = proxy.requests().size();
  EXPECT_EQ(approximateStorageUsedByDataclass("Contacts"), 7);
  EXPECT_EQ(proxy.requests().size(), before);
  EXPECT_EQ(approximateStorageUsedByDataclass("Calendars"), 0);  // failed listing counts nothing
}

}  // namespace
