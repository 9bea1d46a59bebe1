// The client configuration's four layers, with the signed file served by
// the Apache fixture and verified with a key made for the test.
#include <gmock/gmock.h>

#include <algorithm>
#include <filesystem>
#include <fstream>

#include "VantorSyncManager/NubiloSignedDocument.h"
#include "VantorSyncManager/PublicNames.h"
#include "VantorSyncManager/VTCPrefsCenter.h"
#include "localshare/ApacheShare.h"
#include "platform/network/InterfaceAddresses.h"
#include "platform/os/SystemVersion.h"
#include "platform/plist/PlistCodec.h"
#include "platform/prefs/PreferenceStore.h"
#include "prefs/ClientConfiguration.h"
#include "support/FakeTime.h"
#include "support/KeyPair.h"
#include "support/LogCapture.h"
#include "support/TestHome.h"

using vtc::prefs::PreferenceStore;
using vtc::prefs::Scope;

namespace {

class Configuration : public ::testing::Test {
 protected:
  vtc::test::TestHome home;
  vtc::test::LogCapture logged;
  vtc::test::FakeTime time;
  vtc::local::ApacheShare share;
  vtc::test::KeyPair keys{512};
  VTCPrefsCenter& prefs = VTCPrefsCenter::defaultCenter();
  std::string configPath = "/configurations/internetservices/syncworks/clientConfiguration-1.2.3";

  void SetUp() override {
    std::ofstream(home.path() + "/os-release")
        << "NAME=Test\nVERSION_ID=\"1.2.3\"\nBUILD_ID=1A234\n";
    vtc::os::setReleaseFileForTesting(home.path() + "/os-release");
    vtc::config::setVerificationKeyForTesting(keys.publicKey);
    vtc::network::installAddressSource([] { return std::vector<std::string>{"192.168.1.2"}; });
    perUser("ConfigurationHost", vtc::Value("127.0.0.1:" + std::to_string(share.port())));
    prefs.setClientGuid("GUID-1");
  }
  void TearDown() override {
    vtc::os::setReleaseFileForTesting("");
    vtc::config::setVerificationKeyForTesting(std::nullopt);
    vtc::network::installAddressSource({});
  }

  void perUser(const std::string& key, vtc::Value v) {
    PreferenceStore::shared().setValue(key, std::move(v), kVantorDefaultsKey, Scope::AnyHost);
  }
  void perHost(const std::string& key, vtc::Value v) {
    PreferenceStore::shared().setValue(key, std::move(v), kVantorDefaultsKey, Scope::CurrentHost);
  }
  // Serves a configuration signed with the given private key.
  void serve(const vtc::Value& entries, const vtc::Bytes& privateKey) {
    std::string xml = vtc::plist::toXml(entries);
    vtc::Bytes doc(xml.begin(), xml.end());
    auto signature = NubiloSignatureWithKey(doc, privateKey.data(), privateKey.size());
    ASSERT_TRUE(signature);
    NubiloAppendSignature(doc, *signature);
    std::string file = share.diskPath(configPath);
    std::filesystem::create_directories(std::filesystem::path(file).parent_path());
    std::ofstream(file, std::ios::binary)
        .write(reinterpret_cast<const char*>(doc.data()), static_cast<std::streamsize>(doc.size()));
    ::chmod(file.c_str(), 0644);
  }
  size_t downloads() const {
    auto e = share.accessEntries();
    return std::count_if(e.begin(), e.end(), [](const auto& a) { return a.method == "GET"; });
  }
  // The notification coalescing the sync server is told about.
  vtc::Value hysteresis() const {
    return PreferenceStore::shared().copyValue("SyncsAfterHysteresis", "com.korvo.syncserver",
                                               Scope::AnyHost);
  }
  std::string url() const {
    return "http://127.0.0.1:" + std::to_string(share.port()) + configPath +
           "?osBuildVersion=1A234";
  }
};

TEST_F(Configuration, AFreshDownloadIsVerifiedCachedAndOverriddenPerHost) {
  prefs.setSyncTurnedOn(true);
  serve(vtc::Dictionary{{"lock_duration_seconds", 600},
                        {"host_name", "dav.example.org"},
                        {"NotificationConfig", vtc::Dictionary{{"CoalesceDuration", 45}}}},
        keys.privateKey);
  perUser("max_lock_acquire_attempts", vtc::Value(9));
  perHost("lock_duration_seconds", vtc::Value(120));
  perHost("MinAutomaticallySyncInterval", vtc::Value(1));  // protected on an external computer

  vtc::Dictionary c = prefs.defaultConfiguration();
  EXPECT_EQ(downloads(), 1u);
  EXPECT_EQ(c.get("host_name").string(), "dav.example.org");       // the signed layer
  EXPECT_EQ(c.get("max_lock_acquire_attempts").integer(), 9);      // per-user
  EXPECT_EQ(c.get("lock_duration_seconds").integer(), 120);        // per-host beats the file
  EXPECT_EQ(c.get("MinAutomaticallySyncInterval").integer(), 30);  // ignored
  EXPECT_EQ(c.get("guid").string(), "GUID-1");
  EXPECT_EQ(prefs.configTTLDate(), time.now() + std::chrono::hours(24));
  EXPECT_EQ(hysteresis().integer(), 45);
  EXPECT_EQ(logged.messages("Info"),
            (std::vector<std::string>{
                "Downloading new Nubilo Client configuration: " + url(),
                "Cacheing Nubilo Client configuration",
                "Overriding configuration keys with byHost keys for (lock_duration_seconds)"}));

  // Within its lifetime the cached copy serves, without a request or a new hysteresis.
  PreferenceStore::shared().setValue("SyncsAfterHysteresis", vtc::Value(), "com.korvo.syncserver",
                                     Scope::AnyHost);
  time.advance(vtc::Seconds(3600));
  EXPECT_EQ(prefs.defaultConfiguration().get("host_name").string(), "dav.example.org");
  EXPECT_EQ(downloads(), 1u);
  EXPECT_TRUE(hysteresis().isNone());
  EXPECT_EQ(logged.count("Info", "Using cached Nubilo Client configuration"), 1u);
  // After it, a new download.
  time.advance(vtc::Seconds(86400));
  prefs.defaultConfiguration();
  EXPECT_EQ(downloads(), 2u);

  // On an internal computer protected keys count, unless it is told to act as an external one.
  vtc::network::installAddressSource([] { return std::vector<std::string>{"10.96.0.8"}; });
  EXPECT_EQ(prefs.defaultConfiguration().get("MinAutomaticallySyncInterval").integer(), 1);
  perHost("behave_as_external", vtc::Value(true));
  EXPECT_EQ(prefs.defaultConfiguration().get("MinAutomaticallySyncInterval").integer(), 30);
}

TEST_F(Configuration, WithSyncingOffABadSignatureOrAFailedDownloadTheOtherLayersServe) {
  // Syncing off and nothing cached: no request at all.
  serve(vtc::Dictionary{{"host_name", "evil.example.org"}}, vtc::test::KeyPair(512).privateKey);
  EXPECT_EQ(prefs.defaultConfiguration().get("host_name").string(), "sync.nubilo.example");
  EXPECT_TRUE(share.accessEntries().empty());
  EXPECT_EQ(logged.messages("Info"),
            std::vector<std::string>{
                "Syncing is off and no configuration was downloaded before; the built-in "
                "configuration applies"});

  prefs.setSyncTurnedOn(true);
  EXPECT_EQ(prefs.defaultConfiguration().get("host_name").string(), "sync.nubilo.example");
  const std::string badSignature =
      "Failed to validate signature on config file, using default configuration";
  EXPECT_EQ(logged.messages("Error"), std::vector<std::string>{badSignature});

  std::filesystem::remove(share.diskPath(configPath));
  prefs.setConfigTTLDate(std::nullopt);
  EXPECT_EQ(prefs.defaultConfiguration().get("host_name").string(), "sync.nubilo.example");
  std::vector<std::string> errors = logged.messages("Error");
  ASSERT_EQ(errors.size(), 3u);
  // The fetch's own words stand between the URL and the closing blank.
  EXPECT_THAT(errors[1], testing::StartsWith("failed to download Nubilo configuration file from " +
                                             url() + " with error: "));
  EXPECT_THAT(errors[1], testing::EndsWith(" using default configuration "));
  EXPECT_EQ(errors[2], badSignature);
  EXPECT_FALSE(prefs.configTTLDate());  // a failed download does not move it
}

TEST_F(Configuration, AShareWithoutAConfigurationServerIsNeitherAskedNorComplainedAbout) {
  prefs.setSyncTurnedOn(true);
  perUser("ConfigurationHost", vtc::Value(""));
  perUser("host_name", vtc::Value("dav.example.org"));
  EXPECT_EQ(prefs.defaultConfiguration().get("host_name").string(), "dav.example.org");
  EXPECT_TRUE(share.accessEntries().empty());
  EXPECT_TRUE(logged.messages("Error").empty());
}

// The signature verifies, so nothing is said about it; the payload adds no
// keys, and the layers below serve.
TEST_F(Configuration, AVerifiedPayloadThatIsNoDictionaryIsNoBadSignature) {
  prefs.setSyncTurnedOn(true);
  serve(vtc::Value(vtc::Array{vtc::Value("host_name"), vtc::Value("evil.example.org")}),
        keys.privateKey);
  vtc::Dictionary c = prefs.defaultConfiguration();
  EXPECT_EQ(downloads(), 1u);
  EXPECT_EQ(c.get("host_name").string(), "sync.nubilo.example");
  EXPECT_EQ(c.get("guid").string(), "GUID-1");
  EXPECT_TRUE(logged.messages("Error").empty());
}

TEST(ConfigurationDefaults, TheListEndsAtTheFirstAbsentValue) {
  vtc::Dictionary firstRun = vtc::config::builtInDefaults(std::nullopt, std::string("alice"));
  EXPECT_FALSE(firstRun.contains("guid"));
  EXPECT_FALSE(firstRun.contains("inconsistency_ttl"));
  EXPECT_FALSE(firstRun.contains("Name"));
  vtc::Dictionary noName = vtc::config::builtInDefaults(std::string("G"), std::nullopt);
  EXPECT_EQ(noName.get("inconsistency_ttl").integer(), 604800);
  EXPECT_FALSE(noName.contains("Name"));
  // Without a known version or build, the oldest file and no build query.
  EXPECT_EQ(vtc::config::configurationURL("h", std::nullopt, std::string("7")),
            "http://h/configurations/internetservices/syncworks/clientConfiguration-10.5"
            "?osBuildVersion=7");
  EXPECT_EQ(vtc::config::configurationURL("h", std::string("12"), std::string()),
            "http://h/configurations/internetservices/syncworks/clientConfiguration-12");
}

}  // namespace
