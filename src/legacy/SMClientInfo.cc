// SMClientInfo: a client's attributes in one dictionary.
#include "VantorSyncManager/LegacySession.h"
#include "VantorSyncManager/PublicNames.h"
#include "common/Assertions.h"
#include "common/Uuid.h"

namespace {

constexpr const char* kName = "clientname";
constexpr const char* kBuild = "buildversion";
constexpr const char* kClass = "classname";
constexpr const char* kGuid = "guid";
constexpr const char* kLastSync = "lastsync";
constexpr const char* kFirstSync = "firstsync";
constexpr const char* kProperties = "_properties";

}  // namespace

SMClientInfo::SMClientInfo(const std::optional<std::string>& name,
                           const std::optional<std::string>& build,
                           const std::optional<std::string>& className,
                           const std::optional<std::string>& guid)
    : _clientInfo(std::make_shared<vtc::Dictionary>()) {
  if (name) _clientInfo->set(kName, vtc::Value(*name));
  if (build) _clientInfo->set(kBuild, vtc::Value(*build));
  if (className) _clientInfo->set(kClass, vtc::Value(*className));
  if (guid) _clientInfo->set(kGuid, vtc::Value(*guid));
}

SMClientInfo::SMClientInfo(std::shared_ptr<vtc::Dictionary> attributes)
    : _clientInfo(attributes ? std::move(attributes) : std::make_shared<vtc::Dictionary>()) {}

SMClientInfo SMClientInfo::defaultClientWithName(const std::string& name) {
  return SMClientInfo(name, std::nullopt, std::string(SM_CLIENT_CLASS_BRAMBLE),
                      vtc::makeUUIDString());
}

SMClientInfo::SMClientInfo(SMClientInfo&&) noexcept = default;
SMClientInfo& SMClientInfo::operator=(SMClientInfo&&) noexcept = default;
SMClientInfo::~SMClientInfo() = default;

std::optional<std::string> SMClientInfo::text(const char* key) const {
  const vtc::Value& v = valueForKey(key);
  return v.isString() ? std::optional<std::string>(v.string()) : std::nullopt;
}

std::optional<vtc::Date> SMClientInfo::date(const char* key) const {
  const vtc::Value& v = valueForKey(key);
  return v.kind() == vtc::Value::Kind::Date ? std::optional<vtc::Date>(v.date()) : std::nullopt;
}

std::optional<std::string> SMClientInfo::name() const {
  return text(kName);
}

std::optional<std::string> SMClientInfo::guid() const {
  return text(kGuid);
}

std::optional<std::string> SMClientInfo::className() const {
  return text(kClass);
}

std::optional<std::string> SMClientInfo::buildVersion() const {
  return text(kBuild);
}

std::optional<vtc::Date> SMClientInfo::lastSyncDate() const {
  return date(kLastSync);
}

std::optional<vtc::Date> SMClientInfo::firstSyncDate() const {
  return date(kFirstSync);
}

std::optional<vtc::Dictionary> SMClientInfo::properties() const {
  const vtc::Value& v = valueForKey(kProperties);
  return v.isDictionary() ? std::optional<vtc::Dictionary>(v.dictionary()) : std::nullopt;
}

const vtc::Value& SMClientInfo::valueForKey(const std::string& key) const {
  return _clientInfo->get(key);
}

void SMClientInfo::setLastSyncDate(vtc::Date date) {
  _clientInfo->set(kLastSync, vtc::Value(date));
}

void SMClientInfo::setFirstSyncDate(vtc::Date date) {
  _clientInfo->set(kFirstSync, vtc::Value(date));
}

void SMClientInfo::setProperties(const vtc::Dictionary& properties) {
  _clientInfo->set(kProperties, vtc::Value(properties));
}

void SMClientInfo::setName(const std::string&) {
  VTC_ASSERTION_FAILURE("SMClientInfo", "setName",
                        "SMClientInfo setName: is no longer functional and should not be used");
}

std::optional<std::string> SMClientInfo::versionForDataclass(const std::string&) const {
  VTC_ASSERTION_FAILURE(
      "SMClientInfo", "versionForDataclass",
      "SMClientInfo setversionForDataclass: is no longer functional and should not be used");
  return std::nullopt;
}
