// VTCPrefsCenter: the client configuration, from four layers: built-in
// defaults, the per-user domain, the signed downloaded (or cached) file, and
// the per-host preferences.
#include <fstream>
#include <iterator>
#include <set>

#include "VantorSyncManager/Diagnostics.h"
#include "VantorSyncManager/PublicNames.h"
#include "VantorSyncManager/VTCPrefsCenter.h"
#include "common/Clock.h"
#include "common/Format.h"
#include "common/Limits.h"
#include "common/Logging.h"
#include "platform/dav/HttpFetch.h"
#include "platform/fs/LocalPaths.h"
#include "platform/os/SystemVersion.h"
#include "platform/prefs/PreferenceStore.h"
#include "prefs/ClientConfiguration.h"

using vtc::prefs::PreferenceStore;
using vtc::prefs::Scope;

namespace vtc::config {

const std::vector<std::string> kProtectedKeys = {"MinAutomaticallySyncInterval",
                                                 "enable_notify_support",
                                                 "DataclassSyncIntervals",
                                                 "NotificationConfig",
                                                 "automatic_rate_limit_period_seconds",
                                                 "automatic_rate_limit_sync_count",
                                                 "automatic_dataclass_rate_limit_counts",
                                                 "automatic_dataclass_rate_limit_period_seconds"};

namespace {

// The service's own hosts and namespace; reserved example names until a
// deployment names its own through the configuration layers.
constexpr const char* kDefaultSyncHost = "sync.nubilo.example";
constexpr const char* kSyncNamespace = "http://nubilo.example/ns/sync/";
constexpr int kConfigLifetimeSeconds = 86400;

}  // namespace

Dictionary builtInDefaults(const std::optional<std::string>& clientGuid,
                           const std::optional<std::string>& memberName) {
  std::string version = format("%ld", static_cast<long>(VantorSyncManagerVersionNumber));
  Dictionary d{
      {"debug_mode", 0},
      {"sync_namespace", kSyncNamespace},
      {"host_name", kDefaultSyncHost},
      {"host_scheme", "https"},
      {"host_port", 443},
      {"lock_duration_seconds", 240},
      {"lock_renewal_duration_seconds", 20},
      {"max_lock_acquire_attempts", 5},
      {"lock_acquire_sleep_seconds", 4},
      {"enable_notify_support", 1},
      {"sync_path", "/Library/Application Support/SyncWorks"},
      {"sync_manager_version", version},
      {"user_agent", format(_SMUserAgentBase, "-", "-", version)},
  };
  // The list ends at the first absent value: without a client identifier
  // nothing after "guid" is there, without a member name no "Name".
  if (!clientGuid) return d;
  d.set("guid", Value(*clientGuid));
  d.set("DefaultDataclassSyncIntervalSeconds", Value(3600));
  d.set("MinAutomaticallySyncInterval", Value(30));
  d.set("sync_dav_timeout_seconds", Value(90));
  d.set("automatic_rate_limit_period_seconds", Value(3600));
  d.set("automatic_rate_limit_sync_count", Value(60));
  d.set("max_repeated_downloads", Value(100));
  d.set("inconsistency_ttl", Value(604800));
  if (memberName) d.set("Name", Value(*memberName));
  return d;
}

std::string configurationURL(const std::string& host, const std::optional<std::string>& version,
                             const std::optional<std::string>& build) {
  std::string url =
      format("http://%@/%@/%@-%@", host, kConfigURI, kConfigPList, version.value_or("10.5"));
  if (build && !build->empty()) url += format("?osBuildVersion=%@", *build);
  return url;
}

}  // namespace vtc::config

const vtc::Dictionary& VTCPrefsCenter::configuration() {
  std::lock_guard<std::mutex> lock(configurationMutex_);
  if (!_configuration) _configuration = defaultConfiguration();
  return *_configuration;
}

void VTCPrefsCenter::resetConfigurationForTesting() {
  std::lock_guard<std::mutex> lock(configurationMutex_);
  _configuration.reset();
}

vtc::Dictionary VTCPrefsCenter::defaultConfiguration() {
  namespace config = vtc::config;
  auto& store = PreferenceStore::shared();
  vtc::Dictionary configuration = config::builtInDefaults(clientGuid(), username());
  vtc::Dictionary perUser = store.copyMultiple({}, kVantorDefaultsKey, Scope::AnyHost);
  configuration.merge(perUser);

  const vtc::Value& hostOverride = perUser.get(config::kConfigurationHostKey);
  std::string host = hostOverride.isString() ? hostOverride.string() : kConfigHost;
  std::string url =
      config::configurationURL(host, vtc::os::productVersion(), vtc::os::buildVersion());

  // What the layers so far allow decides how large a download may be.
  vtc::setLimits(vtc::Limits::fromConfiguration(configuration));
  const uint64_t most = vtc::limits().configurationBytes;

  std::optional<vtc::Dictionary> signedLayer;
  bool fresh = false;
  std::string caches = vtc::paths::cachesDirectory();
  std::string cacheFile = caches.empty() ? "" : vtc::paths::join(caches, config::kCacheFileName);
  std::optional<vtc::Date> ttl = configTTLDate();
  if (!cacheFile.empty() && ttl && *ttl > vtc::currentClock().now()) {
    std::ifstream in(cacheFile, std::ios::binary | std::ios::ate);
    // Only verified documents are cached; one changed since is not used.
    if (in && static_cast<uint64_t>(in.tellg()) <= most) {
      in.seekg(0);
      VTC_LOG_INFO("Using cached Nubilo Client configuration");
      signedLayer = config::verifiedConfiguration(
          vtc::Bytes((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>()));
    }
  }
  const bool syncing = syncTurnedOn();
  // A self-hosted share has no configuration server: an empty host says so,
  // and nothing is downloaded or waited for.
  const bool noServer = hostOverride.isString() && hostOverride.string().empty();
  if (!signedLayer && syncing && noServer) {
    VTC_LOG_INFO("No configuration server is set, using the default configuration");
  } else if (!signedLayer && syncing) {
    VTC_LOG_INFO("Downloading new Nubilo Client configuration: %@", url);
    std::string error;
    std::optional<vtc::Bytes> data =
        vtc::fetchURL(url, &error, most, vtc::Limits::kConfigurationKey);
    if (!data) {
      VTC_LOG_ERROR(
          "failed to download Nubilo configuration file from %@ with error: %@ using default "
          "configuration ",
          url, error);
    } else if ((signedLayer = config::verifiedConfiguration(*data)) && !cacheFile.empty()) {
      VTC_LOG_INFO("Cacheing Nubilo Client configuration");
      vtc::paths::makeDirectories(caches);
      std::ofstream(cacheFile, std::ios::binary | std::ios::trunc)
          .write(reinterpret_cast<const char*>(data->data()),
                 static_cast<std::streamsize>(data->size()));  // a failed cache write is retried
                                                               // at the next download
      setConfigTTLDate(vtc::currentClock().now() +
                       std::chrono::seconds(config::kConfigLifetimeSeconds));
      synchronize();
      fresh = true;
    }
  }

  if (signedLayer) {
    configuration.merge(*signedLayer);
  } else if (syncing && !noServer) {
    VTC_LOG_ERROR("Failed to validate signature on config file, using default configuration");
  } else if (!noServer) {
    VTC_LOG_INFO(
        "Syncing is off and no configuration was downloaded before; the built-in "
        "configuration applies");
  }

  vtc::Dictionary perHost = store.copyMultiple({}, kVantorDefaultsKey, Scope::CurrentHost);
  const bool internal = isKorvoInternal() && !perHost.get("behave_as_external").boolean();
  if (!internal)
    for (const std::string& key : config::kProtectedKeys) perHost.erase(key);
  std::set<std::string> overridden;
  for (const auto& [key, value] : perHost)
    if (configuration.contains(key)) overridden.insert(key);
  if (!overridden.empty())
    VTC_LOG_INFO("Overriding configuration keys with byHost keys for %@", overridden);
  configuration.merge(perHost);
  vtc::setLimits(vtc::Limits::fromConfiguration(configuration));

  if (fresh) {
    const vtc::Value& coalesce =
        configuration.get("NotificationConfig").dictionary().get("CoalesceDuration");
    store.setValue("SyncsAfterHysteresis", coalesce, "com.korvo.syncserver", Scope::AnyHost);
    store.synchronize("com.korvo.syncserver", Scope::AnyHost);
    store.synchronize("com.korvo.syncserver", Scope::CurrentHost);
  }
  return configuration;
}
