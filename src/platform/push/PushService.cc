#include "platform/push/PushService.h"

#include <openssl/evp.h>
#include <openssl/rand.h>

#include <unistd.h>

#include <cerrno>

#include "VantorSyncManager/PublicNames.h"
#include "common/Logging.h"
#include "platform/bundle/BundleResources.h"
#include "platform/jobs/JobLauncher.h"
#include "platform/plist/PlistCodec.h"
#include "platform/prefs/PreferenceStore.h"
#include "platform/push/PushRegistry.h"

namespace vtc::push {

namespace {

bool usableTopicPart(const std::string& part) {
  return !part.empty() && part.find_first_of(std::string_view("/+#\0", 4)) == std::string::npos;
}

// A client id the broker has not seen: a second connection with the id of
// another would end that one.
std::string freshClientId() {
  unsigned char bytes[8];
  if (RAND_bytes(bytes, sizeof bytes) != 1) return "nbs-" + std::to_string(::getpid());
  std::string id = "nbs-";
  for (unsigned char b : bytes) id += format("%02x", b);
  return id;
}

Dictionary listenerJob() {
  const std::string tool = bundle::pathForTool("nubilosyncclient").value_or("nubilosyncclient");
  return Dictionary{{"Label", kListenerLabel},
                    {"ProgramArguments", Value(Array{Value(tool), "listen"})},
                    {"RunAtLoad", true},
                    {"KeepAlive", true},
                    {"ThrottleInterval", 10}};
}

}  // namespace

Session::Session(MqttConnection::Options options, EventCallback callback, void* context)
    : connection_(std::move(options)), callback_(callback), context_(context) {}

std::optional<BrokerAddress> configuredBroker() {
  auto& store = prefs::PreferenceStore::shared();
  const Value url = store.copyValue(kPushServerKey, kVantorDefaultsKey, prefs::Scope::AnyHost);
  if (!url.isString() || url.string().empty()) return std::nullopt;
  return BrokerAddress::parse(url.string());
}

CertificateTrust configuredBrokerTrust() {
  auto& store = prefs::PreferenceStore::shared();
  auto text = [&](const char* key) {
    const Value v = store.copyValue(key, kVantorDefaultsKey, prefs::Scope::AnyHost);
    return v.isString() ? v.string() : std::string();
  };
  CertificateTrust trust{text(kPushCaFileKey), text(kPushPinnedCertificateKey)};
  if (trust.caFile.empty()) trust.caFile = text("tls_ca_file");
  return trust;
}

std::unique_ptr<Session> createSession(const std::string& account, const std::string& password,
                                       EventCallback callback, void* context) {
  std::optional<BrokerAddress> broker = configuredBroker();
  if (!broker) return nullptr;
  MqttConnection::Options options;
  options.broker = *broker;
  options.trust = configuredBrokerTrust();
  options.clientId = freshClientId();
  options.username = account;
  options.password = password;
  auto session = std::make_unique<Session>(std::move(options), callback, context);
  Session* raw = session.get();
  session->connection().setMessageHandler([raw](const MqttConnection::Message& m) {
    raw->notify(kMessageEvent,
                Value(Dictionary{{"topic", Value(m.topic)}, {"payload", Value(m.payload)}}));
  });
  std::string error;
  if (!session->connection().connect(error)) {
    VTC_LOG_WARNING("Could not open a push session: %@", error);
    return nullptr;
  }
  session->notify(kSessionStatusEvent, Value(1));
  return session;
}

std::string accountDigest(const std::string& account) {
  unsigned char digest[EVP_MAX_MD_SIZE];
  unsigned int length = 0;
  EVP_Digest(account.data(), account.size(), digest, &length, EVP_sha256(), nullptr);
  std::string hex;
  for (unsigned int i = 0; i < 16 && i < length; ++i) hex += format("%02x", digest[i]);
  return hex;
}

std::string topicLevel(std::string_view text) {
  std::string out;
  out.reserve(text.size());
  for (const char c : text) {
    const auto byte = static_cast<unsigned char>(c);
    if (c == '%' || c == '/' || c == '+' || c == '#' || byte < 0x20 || byte == 0x7F)
      out += format("%%%02X", byte);
    else
      out += c;
  }
  return out;
}

int32_t createTopic(const std::string& account, const std::string& organisation,
                    const std::string& service, const std::string& subService,
                    const std::string& dataclass, std::optional<Dictionary>& topicInformation) {
  topicInformation.reset();
  for (const std::string* part : {&organisation, &service, &subService})
    if (!usableTopicPart(*part)) return EINVAL;
  if (account.empty() || dataclass.empty()) return EINVAL;
  const std::string topic = organisation + "/" + service + "/" + subService + "/" +
                            topicLevel(account) + "/" + topicLevel(dataclass);
  topicInformation = Dictionary{{kTopicKey, Value(topic)}};
  return 0;
}

int32_t publish(Session* session, const Dictionary& topicInformation, const Value& payload) {
  const std::string& topic = topicInformation.get(kTopicKey).string();
  if (topic.empty()) return EINVAL;
  if (!session) {
    VTC_LOG_WARNING("Could not publish on %@: no push session", topic);
    return ENOTCONN;
  }
  const Bytes bytes = payload.isNone() ? Bytes() : plist::toBinary(payload);
  std::string error;
  if (!session->connection().publish(topic, bytes, error)) {
    VTC_LOG_WARNING("Could not publish on %@: %@", topic, error);
    return EIO;
  }
  return 0;
}

int32_t enableLaunchable(const std::string& tool, const Dictionary& topicInformation,
                         const std::vector<std::string>& arguments) {
  const std::string& topic = topicInformation.get(kTopicKey).string();
  if (tool.empty() || topic.empty()) return EINVAL;
  std::optional<Registrations> r = readRegistrations();
  if (!r) return EIO;
  std::erase_if(r->launchables,
                [&](const Launchable& l) { return l.tool == tool && l.topic == topic; });
  r->launchables.push_back({tool, topic, arguments});
  return writeRegistrations(*r) ? 0 : EIO;
}

int32_t disableLaunchable(const std::string& tool,
                          const std::optional<Dictionary>& topicInformation) {
  if (!topicInformation) return EINVAL;
  const std::string& topic = topicInformation->get(kTopicKey).string();
  std::optional<Registrations> r = readRegistrations();
  if (!r) return EIO;
  if (std::erase_if(r->launchables,
                    [&](const Launchable& l) { return l.tool == tool && l.topic == topic; }) == 0)
    return ENOENT;
  return writeRegistrations(*r) ? 0 : EIO;
}

void hasOnLoadSession(const std::string& account, int32_t& state) {
  std::optional<Registrations> r = readRegistrations();
  if (!r) return;
  state = 2;
  for (const OnLoadSession& s : r->onLoadSessions)
    if (s.account == account) state = 1;
}

int32_t addOnLoadSession(const std::string& account, const std::string& domain,
                         const std::string& accountPlaceholder, const std::string& service) {
  std::optional<Registrations> r = readRegistrations();
  if (!r || account.empty()) return r ? EINVAL : EIO;
  std::erase_if(r->onLoadSessions, [&](const OnLoadSession& s) { return s.account == account; });
  r->onLoadSessions.push_back({account, domain, accountPlaceholder, service});
  if (!writeRegistrations(*r)) return EIO;
  std::string error;
  const Dictionary job = listenerJob();
  if (!jobs::jobSubmit(job, error)) {
    VTC_LOG_ERROR("Failed with %@ to submit job to taskd %@", error, job);
    return EIO;
  }
  return 0;
}

int32_t removeOnLoadSession(const std::string& account) {
  std::optional<Registrations> r = readRegistrations();
  if (!r) return EIO;
  if (std::erase_if(r->onLoadSessions,
                    [&](const OnLoadSession& s) { return s.account == account; }) == 0)
    return ENOENT;
  if (!writeRegistrations(*r)) return EIO;
  if (!r->onLoadSessions.empty()) return 0;
  std::string error;
  if (!jobs::jobRemove(kListenerLabel, true, error)) {
    VTC_LOG_ERROR("Failed to remove job from taskd %@", error);
    return EIO;
  }
  return 0;
}

}  // namespace vtc::push
