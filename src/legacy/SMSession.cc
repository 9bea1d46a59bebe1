// SMSession: the older session, on top of NubiloRemoteSession.
#include "VantorSyncManager/LegacySession.h"
#include "VantorSyncManager/NubiloRemoteSession.h"
#include "VantorSyncManager/VTCPrefsCenter.h"
#include "common/DateText.h"
#include "common/Logging.h"

namespace {

constexpr const char* kDatePattern = "yyyy-MM-dd HH:mm:ss ZZZ";
constexpr const char* kDatePatternWithMillis = "yyyy-MM-dd HH:mm:ss.SSS ZZZ";

std::optional<std::string> textIn(const vtc::Dictionary& record, const char* key) {
  const vtc::Value& v = record.get(key);
  return v.isString() ? std::optional<std::string>(v.string()) : std::nullopt;
}

}  // namespace

SMSession::SMSession(const std::string& username, const std::string& password) {
  // A copy: the session writes the member name into its configuration.
  vtc::Dictionary configuration = VTCPrefsCenter::defaultCenter().configuration();
  _session = NubiloRemoteSession::sessionWithUsername(username, password, configuration);
}

SMSession::~SMSession() = default;

int32_t SMSession::configuredSessionForUsername(const std::string& username,
                                                const std::string& password,
                                                std::unique_ptr<SMSession>* session, bool) {
  auto made = std::make_unique<SMSession>(username, password);
  if (!session) return 1;
  *session = std::move(made);
  return 0;
}

int32_t SMSession::registerClient(const SMClientInfo& client) {
  _session->registerClient(client.guid().value_or(""), client.name().value_or(""));
  return 0;
}

int32_t SMSession::unregisterClient(const SMClientInfo& client) {
  _session->unregisterClient(client.guid().value_or(""));
  return 0;
}

int32_t SMSession::getAccountClients(std::optional<std::vector<SMClientInfo>>* clients) {
  if (clients) clients->reset();
  vtc::Array records = _session->getAllClientInfo();
  VTCPrefsCenter& prefs = VTCPrefsCenter::defaultCenter();
  const std::optional<std::string> own = prefs.clientGuid();
  std::vector<SMClientInfo> list;
  for (const vtc::Value& value : records) {
    const vtc::Dictionary& record = value.dictionary();
    SMClientInfo client(textIn(record, "clientname"), textIn(record, "buildversion"),
                        textIn(record, "classname"), textIn(record, "guid"));
    if (own && client.guid() == own) {
      // This computer knows its own last sync better than its record does.
      if (std::optional<vtc::Date> date = prefs.lastSuccessfulSyncDate())
        client.setLastSyncDate(*date);
    } else if (const vtc::Value* text = record.find("lastsync")) {
      std::optional<vtc::Date> date = vtc::dates::parse(text->string(), kDatePattern);
      if (!date) date = vtc::dates::parse(text->string(), kDatePatternWithMillis);
      if (date)
        client.setLastSyncDate(*date);
      else
        VTC_LOG_WARNING("Could not interperet date from string %@", *text);
    }
    // Only the plain form is read here; anything else is left unset.
    if (const vtc::Value* text = record.find("firstsync"))
      if (std::optional<vtc::Date> date = vtc::dates::parse(text->string(), kDatePattern))
        client.setFirstSyncDate(*date);
    list.push_back(std::move(client));
  }
  if (clients && !list.empty()) *clients = std::move(list);
  return 0;
}

int32_t SMSession::login() {
  return 0;
}

int32_t SMSession::logout() {
  return 0;
}

int32_t SMSession::resetDataclass(const std::string&) {
  return 0;
}

int32_t SMSession::resetClient(const SMClientInfo&) {
  return 0;
}

int32_t SMSession::unregisterDataclass(const std::string&) {
  return 0;
}

int32_t SMSession::registerDataclass(const std::string&) {
  return 0;
}

int32_t SMSession::updateClient(const SMClientInfo&) {
  return 0;
}

int32_t SMSession::getRegisteredClient(const std::string&, std::optional<SMClientInfo>*) {
  return 0;
}

int32_t SMSession::getChangeInfoForDataclass(const std::string&, int64_t, vtc::Array*) {
  return 0;
}

void SMSession::setUsername(const std::string&) {}

void SMSession::setPassword(const std::string&) {}

void SMSession::setConfiguration(const vtc::Dictionary&) {}
