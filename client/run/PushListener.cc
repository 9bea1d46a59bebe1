#include "client/run/PushListener.h"

#include <sys/stat.h>

#include <algorithm>

#include "VantorSyncManager/VTCPrefsCenter.h"
#include "client/run/Account.h"
#include "client/run/SyncFailure.h"
#include "common/Clock.h"
#include "common/Logging.h"
#include "platform/network/PlainConnection.h"
#include "platform/process/Command.h"
#include "platform/push/MqttConnection.h"
#include "platform/push/PushMessage.h"
#include "platform/push/PushService.h"

namespace vtc::client {

namespace {

constexpr double kFirstPause = 1, kLongestPause = 60;  // seconds between reconnections

std::optional<int64_t> stampOf(const std::optional<std::string>& file) {
  struct stat st {};
  if (!file || ::stat(file->c_str(), &st) != 0) return std::nullopt;
  return int64_t{st.st_mtim.tv_sec} * 1000000000 + st.st_mtim.tv_nsec;
}

// Sleeps in short steps so that a stop request is not kept waiting.
void pause(Seconds total, const std::atomic<bool>& stop) {
  for (Seconds left = total; left.count() > 0 && !stop; left -= Seconds(0.5))
    currentSleeper().sleepFor(std::min(left, Seconds(0.5)));
}

}  // namespace

PushListener::PushListener(Options options) : options_(std::move(options)) {
  if (!push::configuredBroker())
    throw SyncFailure(FailureKind::Usage,
                      "No push server is set up; add one with `nubilosyncclient setup URL --user "
                      "NAME --push mqtt[s]://HOST[:PORT]`.");
  std::tie(member_, password_) = storedCredentials();
  hold_.emplace();
  guid_ = VTCPrefsCenter::defaultCenter().clientGuid().value_or("");
  if (!options_.say) options_.say = [](const std::string&) {};
}

PushListener::~PushListener() {
  wipe(password_);
}

void PushListener::refreshRegistrations() {
  const std::optional<std::string> file = push::registrationsFile();
  const std::optional<int64_t> stamp = stampOf(file);
  if (stamp == registrationsStamp_ && registrationsStamp_) return;
  registrationsStamp_ = stamp;
  std::optional<push::Registrations> r = push::readRegistrations();
  if (!r) {
    VTC_LOG_ERROR("The push registrations in %@ cannot be read; keeping the ones read before",
                  file.value_or("the support folder"));
    return;
  }
  launchables_ = r->launchables;
}

void PushListener::queue(const std::string& topic) {
  if (std::ranges::find(pending_, topic) == pending_.end()) pending_.push_back(topic);
}

void PushListener::handle(const std::string& topic, ByteView payload) {
  const std::optional<push::PushMessage> message = push::decodePushMessage(payload);
  if (!message) {
    VTC_LOG_WARNING("A message of %d bytes on %@ is no announcement of a computer; ignored",
                    payload.size(), topic);
    return;
  }
  const std::string& from = message->guid;
  if (!guid_.empty() && from == guid_) return;  // this computer's own announcement
  VTC_LOG_INFO("Push on %@ from %@", topic,
               from.empty() ? std::string("an unknown computer") : from);
  const auto now = std::chrono::steady_clock::now();
  collect();  // a run that has just ended leaves the way free
  if (now - lastPush_ >= options_.quiet && running_ < 0 && pending_.empty()) startNow_ = true;
  lastPush_ = now;
  queue(topic);
}

void PushListener::collect() {
  if (running_ <= 0) return;
  std::optional<int> status = process::collect(running_, false);
  if (!status) return;
  VTC_LOG_INFO("The sync for the push on %@ ended with status %d", runningTopic_, *status);
  // Another sync of this computer held the owner lock: this one is still
  // due, after a quiet interval.
  if (*status == static_cast<int>(FailureKind::Busy)) {
    queue(runningTopic_);
    lastPush_ = std::chrono::steady_clock::now();
  }
  running_ = -1;
}

void PushListener::startDue() {
  collect();
  if (running_ > 0 || pending_.empty() ||
      (!startNow_ && std::chrono::steady_clock::now() - lastPush_ < options_.quiet))
    return;
  startNow_ = false;
  const std::string topic = pending_.front();
  pending_.pop_front();
  auto launchable = std::ranges::find(launchables_, topic, &push::Launchable::topic);
  if (launchable == launchables_.end()) return;  // unregistered meanwhile
  std::vector<std::string> argv{launchable->tool};
  argv.insert(argv.end(), launchable->arguments.begin(), launchable->arguments.end());
  VTC_LOG_INFO("Running %@ for the push on %@", argv, topic);
  running_ = process::spawn(argv);
  runningTopic_ = topic;
  if (running_ < 0) VTC_LOG_ERROR("Could not start %@ for a push", argv);
}

void PushListener::run(const std::atomic<bool>& stop) {
  const push::BrokerAddress broker = *push::configuredBroker();
  push::MqttConnection::Options connection;
  connection.broker = broker;
  // A fixed id and a kept session: pushes published while this computer is
  // briefly away wait on the server for it.
  connection.clientId = "nbl-" + push::accountDigest(guid_.empty() ? member_ : guid_).substr(0, 16);
  connection.username = member_;
  connection.password = password_;
  connection.cleanSession = false;
  connection.trust = push::configuredBrokerTrust();
  push::MqttConnection mqtt(connection);
  mqtt.setMessageHandler([this](const push::MqttConnection::Message& m) {
    if (std::ranges::find(launchables_, m.topic, &push::Launchable::topic) != launchables_.end())
      handle(m.topic, m.payload);
  });

  Seconds pauseLength(kFirstPause);
  bool connectedBefore = false;
  while (!stop) {
    refreshRegistrations();
    bool announce = false;
    if (!mqtt.connected()) {
      std::string error;
      subscribed_.clear();
      if (!mqtt.connect(error)) {
        VTC_LOG_WARNING("Push listener: %@; trying again in %@ seconds", error,
                        pauseLength.count());
        pause(pauseLength, stop);
        pauseLength = std::min(pauseLength * 2, Seconds(kLongestPause));
        startDue();
        continue;
      }
      pauseLength = Seconds(kFirstPause);
      if (!broker.tls)
        if (auto warning =
                network::passwordInClearWarning(member_, broker.host, broker.url(), "MQTT"))
          options_.say("Warning: " + *warning);
      if (connectedBefore) {
        // Whatever was announced while the connection was down may be lost.
        for (const push::Launchable& l : launchables_) queue(l.topic);
      }
      connectedBefore = true;
      announce = true;
    }
    std::vector<std::string> wanted;
    for (const push::Launchable& l : launchables_) wanted.push_back(l.topic);
    std::vector<std::string> gone, added;
    for (const std::string& t : subscribed_)
      if (std::ranges::find(wanted, t) == wanted.end()) gone.push_back(t);
    for (const std::string& t : wanted)
      if (std::ranges::find(subscribed_, t) == subscribed_.end()) added.push_back(t);
    if (!gone.empty() || !added.empty()) {
      std::string error;
      if (!mqtt.unsubscribe(gone, error) || !mqtt.subscribe(added, error)) {
        VTC_LOG_WARNING("Push listener: %@", error);
        continue;  // the connection is gone; the next turn makes a new one
      }
      subscribed_ = wanted;
      announce = true;
    }
    if (announce) {
      VTC_LOG_INFO("Listening for pushes from %@ on %@", broker.url(), subscribed_);
      if (subscribed_.empty())
        options_.say("Connected to " + broker.url() +
                     ", but no dataclass is registered for pushes yet; run `nubilosyncclient "
                     "push on`.");
      else
        options_.say("Listening for pushes from " + broker.url() + " for " +
                     std::to_string(subscribed_.size()) + " dataclass" +
                     (subscribed_.size() == 1 ? "" : "es") + ".");
    }
    mqtt.poll(options_.tick);
    startDue();
  }
  if (running_ > 0) process::collect(running_, true);
}

}  // namespace vtc::client
