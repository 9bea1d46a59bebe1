// NotifyHelper against a real push server (mosquitto on a free port, one
// account, once with TLS): what reaches a subscriber, what is registered
// for launch and at login, and what is logged when parts fail. The user
// manager is a stand-in that records its calls.
#include <gmock/gmock.h>

#include <stdlib.h>

#include <chrono>
#include <filesystem>
#include <map>

#include "VantorSyncManager/NotifyHelper.h"
#include "VantorSyncManager/PublicNames.h"
#include "VantorSyncManager/VTCPrefsCenter.h"
#include "localshare/ApacheShare.h"
#include "localshare/Computer.h"
#include "platform/plist/PlistCodec.h"
#include "platform/prefs/PreferenceStore.h"
#include "platform/push/MqttConnection.h"
#include "platform/push/PushRegistry.h"
#include "platform/push/PushService.h"
#include "platform/secrets/StoredAccount.h"
#include "support/LogCapture.h"
#include "support/MqttBroker.h"
#include "support/TestHome.h"
#include "support/UserManagerStandIn.h"

using testing::Contains;
using testing::ElementsAre;
using testing::HasSubstr;
using testing::StartsWith;
using vtc::Value;
using vtc::local::ApacheShare;
using vtc::prefs::PreferenceStore;
using vtc::prefs::Scope;

namespace {

constexpr const char* kPassword = ApacheShare::kPassword;
const std::string kAccount = ApacheShare::kUser;

class Notify : public ::testing::Test {
 protected:
  vtc::test::TestHome home;
  vtc::test::LogCapture logged;
  vtc::test::UserManagerStandIn manager;
  std::unique_ptr<vtc::test::MqttBroker> broker;

  Notify() { NotifyHelper::resetSharedHelperForTesting(); }
  ~Notify() override { NotifyHelper::resetSharedHelperForTesting(); }

  void startBroker(bool tls = false) {
    broker = std::make_unique<vtc::test::MqttBroker>(vtc::test::MqttBroker::Options{tls});
    PreferenceStore::shared().setValue(vtc::push::kPushServerKey, Value(broker->url()),
                                       kVantorDefaultsKey, Scope::AnyHost);
  }
  // A connection of an account of the push server, as another computer.
  std::unique_ptr<vtc::push::MqttConnection> connection(const std::string& user,
                                                        const std::string& password,
                                                        vtc::CertificateTrust trust = {}) {
    vtc::push::MqttConnection::Options options;
    options.broker = *vtc::push::BrokerAddress::parse(broker->url());
    options.clientId = "test-" + user;
    options.username = user;
    options.password = password;
    options.trust = std::move(trust);
    auto c = std::make_unique<vtc::push::MqttConnection>(options);
    std::string error;
    EXPECT_TRUE(c->connect(error)) << error;
    return c;
  }
  // A subscriber to every sync topic of the account, as another computer.
  std::unique_ptr<vtc::push::MqttConnection> subscriber(vtc::CertificateTrust trust = {}) {
    auto c = connection(kAccount, kPassword, std::move(trust));
    std::string error;
    EXPECT_TRUE(c->subscribe({"korvo/nubilo/syncdav/" + kAccount + "/#"}, error)) << error;
    return c;
  }
  // The messages that reach the subscriber until one arrives on the marker
  // dataclass (published last, on the same session, so after the others).
  static std::multimap<std::string, Value> until(vtc::push::MqttConnection& c,
                                                 const std::string& marker) {
    std::multimap<std::string, Value> received;
    bool done = false;
    c.setMessageHandler([&](const vtc::push::MqttConnection::Message& m) {
      const std::string dataclass = m.topic.substr(m.topic.rfind('/') + 1);
      if (dataclass == marker)
        done = true;
      else
        received.emplace(m.topic, vtc::plist::parse(m.payload).value_or(Value()));
    });
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(5);
    while (!done && std::chrono::steady_clock::now() < deadline)
      c.poll(std::chrono::milliseconds(50));
    EXPECT_TRUE(done);
    return received;
  }
  std::string topic(const std::string& dataclass) const {
    return "korvo/nubilo/syncdav/" + kAccount + "/" + dataclass;
  }
  std::vector<vtc::push::Launchable> launchables() const {
    return vtc::push::readRegistrations().value_or(vtc::push::Registrations{}).launchables;
  }
};

TEST_F(Notify, TwoPayloadsQueuedForADataclassArePublishedOnceWithTheSecondByTheFirstHelper) {
  startBroker();
  auto other = subscriber();
  NotifyHelper& helper = NotifyHelper::notificationSessionForAccount(kAccount, kPassword);
  helper.sendNotifications();  // nothing queued: nothing happens
  EXPECT_FALSE(helper.queuedNotifications());
  // A later call with another account gets the first helper unchanged.
  NotifyHelper& second = NotifyHelper::notificationSessionForAccount("bob", "other password");
  EXPECT_EQ(&helper, &second);
  helper.addDataclassToNotify("com.korvo.Contacts", Value("first"));
  helper.addDataclassToNotify("com.korvo.Calendars", Value("calendars"));
  second.addDataclassToNotify("com.korvo.Contacts", Value("second"));
  helper.sendNotifications();
  EXPECT_FALSE(helper.queuedNotifications());
  helper.addDataclassToNotify("marker", Value());
  helper.sendNotifications();

  std::multimap<std::string, Value> received = until(*other, "marker");
  EXPECT_THAT(received, ElementsAre(std::pair(topic("com.korvo.Calendars"), Value("calendars")),
                                    std::pair(topic("com.korvo.Contacts"), Value("second"))));
  EXPECT_THAT(logged.messages("Info"),
              Contains("Publishing to topic = " + topic("com.korvo.Contacts")));
}

TEST_F(Notify, EnablingQueuesTheDataclassEvenWhenTheTopicOrTheRegistrationFails) {
  startBroker();
  NotifyHelper& helper = NotifyHelper::notificationSessionForAccount(kAccount, kPassword);
  VTCPrefsCenter& prefs = VTCPrefsCenter::defaultCenter();

  helper.enableDataclassForNotifications("com.korvo.Contacts");
  ASSERT_EQ(launchables().size(), 1u);
  EXPECT_EQ(launchables()[0].topic, topic("com.korvo.Contacts"));
  EXPECT_THAT(launchables()[0].tool, testing::EndsWith("/nubilosyncclient"));
  EXPECT_THAT(launchables()[0].arguments,
              ElementsAre("--sync", "--dataclasses", "com.korvo.Contacts"));

  helper.enableDataclassForNotifications("com.korvo+odd");  // a wildcard, escaped as a level
  ASSERT_EQ(launchables().size(), 2u);
  EXPECT_EQ(launchables()[1].topic, topic("com.korvo%2Bodd"));
  helper.disableDataclassForNotifications("com.korvo+odd");
  const std::string file = *vtc::push::registrationsFile();
  std::filesystem::rename(file, file + ".kept");
  std::filesystem::create_directories(file);  // the registrations cannot be read
  helper.enableDataclassForNotifications("com.korvo.Calendars");
  EXPECT_THAT(logged.messages("Warning"),
              Contains("Cannot enable notification launch for dataclass com.korvo.Calendars - "
                       "error code 5 returned."));
  auto queued = prefs.getQueuedDataclasses(true).value_or(std::vector<std::string>{});
  std::ranges::sort(queued);
  EXPECT_THAT(queued, ElementsAre("com.korvo+odd", "com.korvo.Calendars", "com.korvo.Contacts"));
  EXPECT_EQ(logged.count("Info",
                         "com.korvo.Calendars enabled for notifications, adding to "
                         "dataclass queue"),
            1u);

  std::filesystem::remove(file);
  std::filesystem::rename(file + ".kept", file);
  helper.disableDataclassForNotifications("com.korvo.Contacts");
  EXPECT_TRUE(launchables().empty());
  EXPECT_THAT(logged.messages("Info"),
              Contains("Removing subscription for topic = " + topic("com.korvo.Contacts")));
  helper.disableDataclassForNotifications("com.korvo.Contacts");
  EXPECT_THAT(logged.messages("Warning").back(),
              "Cannot disable notification launch for dataclass com.korvo.Contacts - error code 2 "
              "returned.");
  EXPECT_TRUE(prefs.getQueuedDataclasses(true).value_or(std::vector<std::string>{}).empty());

  // A helper made bare registers for the account stored in the
  // preferences, one whose name holds a wildcard and a separator too.
  const std::string plus = "alice+sync/home@example.org";
  PreferenceStore::shared().setValue(vtc::kAccountNameKey, Value(plus), kVantorDefaultsKey,
                                     Scope::AnyHost);
  NotifyHelper bare("com.korvo.NubiloPrefs");
  bare.enableDataclassForNotifications("com.korvo.Contacts");
  ASSERT_EQ(launchables().size(), 1u);
  EXPECT_EQ(launchables()[0].topic,
            "korvo/nubilo/syncdav/alice%2Bsync%2Fhome@example.org/com.korvo.Contacts");
}

TEST_F(Notify, TheLoginSessionIsAddedOnlyWhenNoneIsAndNothingMovesWhileItsStateIsUnknown) {
  const std::string unit =
      home.path() + "/.config/systemd/user/com.korvo.NubiloPushListener.service";
  EXPECT_EQ(NotifyHelper::isBeaconEnabledForAccount(kAccount), 2);
  NotifyHelper::setBeaconEnabled(true, kAccount);
  EXPECT_EQ(NotifyHelper::isBeaconEnabledForAccount(kAccount), 1);
  EXPECT_THAT(vtc::local::Computer::read(unit), HasSubstr("nubilosyncclient listen\n"));
  EXPECT_THAT(vtc::local::Computer::read(unit), HasSubstr("Restart=always\n"));
  EXPECT_THAT(manager.calls(), ElementsAre("daemon-reload", "enable --now --no-block " + unit));
  EXPECT_EQ(vtc::push::readRegistrations()->onLoadSessions.at(0).service, "Kitbag");

  manager.forgetCalls();
  NotifyHelper::setBeaconEnabled(true, kAccount);  // state 1: never a second one
  EXPECT_TRUE(manager.calls().empty());
  EXPECT_EQ(vtc::push::readRegistrations()->onLoadSessions.size(), 1u);

  NotifyHelper::setBeaconEnabled(false, kAccount);
  EXPECT_EQ(NotifyHelper::isBeaconEnabledForAccount(kAccount), 2);
  EXPECT_FALSE(std::filesystem::exists(unit));
  EXPECT_THAT(manager.calls(),
              ElementsAre("disable --now com.korvo.NubiloPushListener.service", "daemon-reload"));

  manager.forgetCalls();
  vtc::local::Computer::write(*vtc::push::registrationsFile(), "not a property list");
  EXPECT_EQ(NotifyHelper::isBeaconEnabledForAccount(kAccount), -1);
  NotifyHelper::setBeaconEnabled(true, kAccount);
  NotifyHelper::setBeaconEnabled(false, kAccount);
  EXPECT_TRUE(manager.calls().empty());
  EXPECT_EQ(vtc::local::Computer::read(*vtc::push::registrationsFile()), "not a property list");
}

TEST_F(Notify, AMissingOrRefusingServerLeavesNoSessionPublishingIsTriedAndNoPasswordIsLogged) {
  NotifyHelper& helper = NotifyHelper::notificationSessionForAccount(kAccount, kPassword);
  EXPECT_THAT(logged.messages("Warning"),
              ElementsAre("Could not schedule the Beacon Notification session - invalid session "
                          "returned"));
  helper.addDataclassToNotify("com.korvo.Contacts", Value("x"));
  helper.sendNotifications();
  EXPECT_FALSE(helper.queuedNotifications());
  EXPECT_THAT(logged.messages("Warning").back(),
              "Could not publish on " + topic("com.korvo.Contacts") + ": no push session");

  startBroker();
  NotifyHelper::resetSharedHelperForTesting();
  NotifyHelper::notificationSessionForAccount(kAccount, "a wrong password");
  EXPECT_THAT(logged.messages("Warning"),
              Contains(StartsWith("Could not open a push session: the push server at " +
                                  broker->url() + " refused the connection")));

  for (const auto& line : logged.lines()) {
    EXPECT_THAT(line.message, testing::Not(HasSubstr("wrong password")));
    EXPECT_THAT(line.message, testing::Not(HasSubstr(kPassword)));
  }
}

TEST_F(Notify, OverTlsTheSessionTrustsTheAuthorityItIsGivenOrThePinnedCertificateAlone) {
  startBroker(true);
  auto set = [](const char* key, const std::string& value) {
    PreferenceStore::shared().setValue(key, value.empty() ? Value() : Value(value),
                                       kVantorDefaultsKey, Scope::AnyHost);
  };
  auto sessionWarning = [&] {
    NotifyHelper::resetSharedHelperForTesting();
    NotifyHelper::notificationSessionForAccount(kAccount, kPassword);
    const auto warnings = logged.messages("Warning");
    return warnings.empty() ? std::string() : warnings.back();
  };
  set(vtc::push::kPushCaFileKey, broker->certificateFile());
  auto other = subscriber({broker->certificateFile(), ""});
  const std::string digest = other->certificateDigest();
  EXPECT_THAT(digest, testing::MatchesRegex("([0-9a-f]{2}:){31}[0-9a-f]{2}"));
  NotifyHelper& helper = NotifyHelper::notificationSessionForAccount(kAccount, kPassword);
  helper.addDataclassToNotify("com.korvo.Contacts", Value("over TLS"));
  helper.addDataclassToNotify("marker", Value());
  helper.sendNotifications();
  EXPECT_EQ(until(*other, "marker").count(topic("com.korvo.Contacts")), 1u);
  EXPECT_THAT(logged.messages("Warning"), testing::Not(Contains(HasSubstr("unencrypted"))));

  set(vtc::push::kPushCaFileKey, "");  // the server's own authority is no system one
  EXPECT_EQ(sessionWarning(),
            "Could not schedule the Beacon Notification session - invalid "
            "session returned");
  EXPECT_THAT(logged.messages("Warning"),
              Contains("Could not open a push session: the push server at " + broker->url() +
                       " has a certificate that no authority this computer trusts vouches for"));

  set(vtc::push::kPushPinnedCertificateKey, digest);  // trusted alone, no authority needed
  const size_t warnings = logged.messages("Warning").size();
  sessionWarning();
  EXPECT_EQ(logged.messages("Warning").size(), warnings);

  set(vtc::push::kPushPinnedCertificateKey, std::string(digest).replace(0, 2, "00"));
  sessionWarning();
  EXPECT_THAT(logged.messages("Warning"),
              Contains("Could not open a push session: the push server at " + broker->url() +
                       " shows a certificate other than the pinned one (its SHA-256 digest is "
                       "now " +
                       digest + ")"));
}

TEST_F(Notify, AnotherAccountOfTheServerCanNeitherReadNorTriggerTheAccountsPushes) {
  startBroker();
  auto own = subscriber();
  auto mallory =
      connection(vtc::test::MqttBroker::kOtherUser, vtc::test::MqttBroker::kOtherPassword);
  std::vector<std::string> seen;
  mallory->setMessageHandler(
      [&](const vtc::push::MqttConnection::Message& m) { seen.push_back(m.topic); });
  std::string error;
  // Refused by the server, or granted and never served: either way nothing.
  mallory->subscribe({"korvo/nubilo/syncdav/#"}, error);
  mallory->subscribe(
      {"korvo/nubilo/syncdav/" + std::string(vtc::test::MqttBroker::kOtherUser) + "/#"}, error);
  // A push that would start a sync on the account's computers.
  mallory->publish(topic("com.korvo.Contacts"), {}, error);

  NotifyHelper& helper = NotifyHelper::notificationSessionForAccount(kAccount, kPassword);
  helper.addDataclassToNotify("com.korvo.Calendars", Value("own"));
  helper.addDataclassToNotify("marker", Value());
  helper.sendNotifications();
  EXPECT_THAT(until(*own, "marker"),
              ElementsAre(std::pair(topic("com.korvo.Calendars"), Value("own"))));
  // Its own topics work as ever.
  const std::string itsOwn =
      "korvo/nubilo/syncdav/" + std::string(vtc::test::MqttBroker::kOtherUser) + "/x";
  ASSERT_TRUE(mallory->publish(itsOwn, {}, error)) << error;
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(5);
  while (std::ranges::count(seen, itsOwn) == 0 && std::chrono::steady_clock::now() < deadline)
    mallory->poll(std::chrono::milliseconds(50));
  EXPECT_THAT(seen, testing::AllOf(testing::Not(testing::IsEmpty()), testing::Each(itsOwn)));

  // A name that no pattern applies to has its pushes through the lines of
  // its own that the guide shows.
  const std::string plus = vtc::test::MqttBroker::kPlusUser;
  auto plusOther = connection(plus, kPassword);
  ASSERT_TRUE(plusOther->subscribe({"korvo/nubilo/syncdav/alice%2Bsync@example.org/#"}, error))
      << error;
  NotifyHelper::resetSharedHelperForTesting();
  NotifyHelper& plusHelper = NotifyHelper::notificationSessionForAccount(plus, kPassword);
  plusHelper.addDataclassToNotify("com.korvo.Contacts", Value("plus"));
  plusHelper.addDataclassToNotify("marker", Value());
  plusHelper.sendNotifications();
  EXPECT_THAT(until(*plusOther, "marker"),
              ElementsAre(std::pair(
                  std::string("korvo/nubilo/syncdav/alice%2Bsync@example.org/com.korvo.Contacts"),
                  Value("plus"))));
}

}  // namespace
