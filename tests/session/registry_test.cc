// The dataclass and client registries as whole scenarios on a real share,
// with the server's state checked through a second session.
#include <gtest/gtest.h>

#include <algorithm>
#include <cstring>
#include <filesystem>

#include "VantorSyncManager/NubiloException.h"
#include "VantorSyncManager/NubiloRemoteSession.h"
#include "VantorSyncManager/PublicNames.h"
#include "VantorSyncManager/VTCPrefsCenter.h"
#include "common/Format.h"
#include "platform/dav/TesselSession.h"
#include "support/ApacheShare.h"
#include "support/FakeTime.h"
#include "support/FaultProxy.h"
#include "support/ShareTest.h"
#include "support/TestHome.h"
#include "support/TraceCapture.h"

using vtc::test::ApacheShare;

namespace {

constexpr const char* kNs = "http://nubilo.example/ns/sync/";

class Registry : public vtc::test::ShareTest {
 protected:
  std::unique_ptr<NubiloRemoteSession> open(const std::string& guid) {
    return openSession(clientOverrides(guid));
  }

  // The record of a server path as a second session sees it.
  vtc::Dictionary recordAt(NubiloRemoteSession& s, const std::string& path) {
    DavTransaction t = s.tesselSession()._issuePropFindAtPath(path, 0, {});
    vtc::Dictionary record;
    if (!t.isSuccessful()) return record;
    for (const auto& [name, value] : t.result().dictionary().begin()->second.dictionary())
      if (name.starts_with(kNs)) record.set(name.substr(std::strlen(kNs)), value);
    return record;
  }

  void putChangelogs(NubiloRemoteSession& s, const std::string& dataclass, int from, int to) {
    for (int i = from; i <= to; ++i)
      ASSERT_TRUE(
          s.tesselSession()
              .putData({'c', static_cast<uint8_t>(i)}, s.changeLogPathForDataclass(dataclass, i))
              .isSuccessful());
    s.setInfoForDataclass(vtc::Dictionary{{"minversion", vtc::format("%05i", from)},
                                          {"maxversion", vtc::format("%05i", to)}},
                          dataclass);
  }

  size_t requests(const std::string& method) const {
    auto e = share.accessEntries();
    return std::count_if(e.begin(), e.end(), [&](const auto& a) { return a.method == method; });
  }
};

TEST_F(Registry, ADataclassFromUnregisteredToPopulatedToResetToGone) {
  auto a = open("GUID-A");
  auto observer = open("GUID-OBSERVER");
  std::string collection = a->schemasPath() + "/com.korvo.Contacts/";

  EXPECT_TRUE(recordAt(*observer, collection).empty());
  vtc::Dictionary record = a->getDataclassInfo("com.korvo.Contacts");  // registers it
  std::vector<std::string> keys = record.keys();
  std::sort(keys.begin(), keys.end());
  EXPECT_EQ(keys, (std::vector<std::string>{"DAV:getetag", "dataclassname", "displayname"}));
  EXPECT_EQ(recordAt(*observer, collection).get("dataclassname").string(), "com.korvo.Contacts");
  EXPECT_EQ(a->dataclassNames(), std::vector<std::string>{"com.korvo.Contacts"});
  EXPECT_TRUE(a->validPropertiesForDataclass("com.korvo.Contacts"));

  a->lockDataclass("com.korvo.Contacts");
  putChangelogs(*a, "com.korvo.Contacts", 1, 3);
  a->tesselSession().putData({'x'}, a->schemasPath() + "/com.korvo.Contacts/00004.clog.tmp");
  EXPECT_EQ(a->changeLogVersionsForDataclass("com.korvo.Contacts"),
            (std::vector<std::string>{"00001", "00002", "00003"}));
  EXPECT_TRUE(a->validPropertiesForDataclass("com.korvo.Contacts"));
  EXPECT_EQ(a->calculateStorageConsumedForDataclass("com.korvo.Contacts"), 7);
  EXPECT_EQ(recordAt(*observer, collection).get("maxversion").string(), "00003");

  // An incoherent record is found and repaired from the files present.
  a->setInfoForDataclass(vtc::Dictionary{{"maxversion", "00005"}}, "com.korvo.Contacts");
  EXPECT_FALSE(a->validPropertiesForDataclass("com.korvo.Contacts"));
  a->setInfoForDataclass(a->calculatePropertiesForDataclass("com.korvo.Contacts"),
                         "com.korvo.Contacts");
  EXPECT_TRUE(a->validPropertiesForDataclass("com.korvo.Contacts"));

  // Fast reset: the collection goes to the trash in one move.
  a->resetDataclass("com.korvo.Contacts");
  vtc::Dictionary afterReset = recordAt(*observer, collection);
  EXPECT_FALSE(afterReset.contains("minversion"));
  EXPECT_FALSE(afterReset.contains("maxversion"));
  EXPECT_FALSE(afterReset.contains("status"));
  EXPECT_TRUE(a->changeLogVersionsForDataclass("com.korvo.Contacts").empty());
  EXPECT_EQ(requests("MOVE"), 1u);
  std::string trash = share.diskPath("/Web/.Temporary Web Resources/SyncWorks/Trash");
  ASSERT_TRUE(std::filesystem::is_directory(trash));
  EXPECT_EQ(std::distance(std::filesystem::directory_iterator(trash), {}), 1);
  EXPECT_TRUE(a->lockedResources().count(collection));

  a->unlockDataclass("com.korvo.Contacts");
  EXPECT_TRUE(a->unregisterDataclass("com.korvo.Contacts"));
  EXPECT_TRUE(recordAt(*observer, collection).empty());
  EXPECT_TRUE(a->getAllDataclassInfo().empty());
  EXPECT_TRUE(a->lockedResources().empty());
}

TEST_F(Registry, ClientsRegisterAndABrokenRecordIsCleanedUp) {
  auto a = open("GUID-A");
  auto b = open("GUID-B");
  auto c = open("GUID-C");
  EXPECT_TRUE(a->registerClient("GUID-A", "Alice's \x07Mac"));
  EXPECT_TRUE(b->registerClient("GUID-B", "Bob's Mac"));
  EXPECT_TRUE(c->registerClient("GUID-C", "Carol's Mac"));
  EXPECT_THROW(a->registerClient("GUID-A", "again"), NubiloException);

  vtc::Dictionary record = b->getClientInfo("GUID-A");

  EXPECT_EQ(record.get("classname").string(), "bramble");
  EXPECT_EQ(record.get("buildversion").string(), "VantorSyncClient-488.5");
  EXPECT_EQ(VTCPrefsCenter::defaultCenter().clientGuid(), "GUID-C");  // the last to register here

  // Carol's record loses its name: listed once more, then removed.
  c->setInfoForClient(vtc::Dictionary{{"clientname", kNBRemoveProp}}, "GUID-C");
  vtc::Array all = a->getAllClientInfo();
  EXPECT_EQ(all.size(), 3u);
  EXPECT_FALSE(std::filesystem::exists(share.diskPath(a->clientsPath() + "/GUID-C.client")));
  EXPECT_EQ(a->getAllClientInfo().size(), 2u);
  try {
    a->getClientInfo("GUID-C");
    FAIL() << "no exception";
  } catch (const NubiloException& e) {
    EXPECT_EQ(e.name(), NubiloClientRegistrationException);
  }
  EXPECT_TRUE(b->unregisterClient("GUID-B"));
  EXPECT_EQ(a->getAllClientInfo().size(), 1u);
}

TEST_F(Registry, AResetMarksEveryOtherClientNeedingTheTruth) {
  auto a = open("GUID-A");
  for (const char* guid : {"GUID-A", "GUID-B", "GUID-C"}) a->registerClient(guid, guid);
  a->setInfoForClient(vtc::Dictionary{{"Contacts.version", "7"}, {"Contacts.status", "normal"}},
                      "GUID-B");
  a->getDataclassInfo("Contacts");
  a->lockDataclass("Contacts");
  a->resetDataclass("Contacts");
  a->unlockDataclass("Contacts");
  EXPECT_EQ(a->getClientInfo("GUID-B").get("Contacts.status").string(), "needstruth");
  EXPECT_FALSE(a->getClientInfo("GUID-B").contains("Contacts.version"));
  EXPECT_EQ(a->getClientInfo("GUID-C").get("Contacts.status").string(), "needstruth");
  EXPECT_FALSE(a->getClientInfo("GUID-A").contains("Contacts.status"));  // not the resetter
}

TEST_F(Registry, StatusesAlreadyInPlaceCostOnlyTheListingAndTheReads) {
  // Counted at a proxy, which sees each request as it is sent (the server
  // logs a request only after answering it).
  vtc::test::FaultProxy proxy(share.port());
  vtc::Dictionary config = share.configuration();
  config.set("host_port", vtc::Value(proxy.port()));
  config.set("guid", vtc::Value("GUID-A"));
  auto a = NubiloRemoteSession::sessionWithUsername("alice", "wonderland", config);
  for (int i = 0; i < 10; ++i) a->registerClient(vtc::format("GUID-%d", i), "machine");
  a->lockClients();
  a->setOtherClientStatus("needstruth", "Contacts");
  size_t before = proxy.requests().size();
  size_t patchesBefore = proxy.count("PROPPATCH");
  a->setOtherClientStatus("needstruth", "Contacts");
  size_t sent = proxy.requests().size() - before;
  EXPECT_EQ(proxy.count("PROPPATCH"), patchesBefore);
  EXPECT_EQ(sent, 12u);  // relock, listing, ten reads
  RecordProperty("requests_for_ten_unchanged_clients", static_cast<int>(sent));
  a->unlockClients();
}

}  // namespace
