#include "platform/secrets/CredentialStore.h"

#include <libsecret/secret.h>

namespace vtc::secrets {

namespace {

// Items are matched by their attributes alone, whatever schema wrote them.
const SecretSchema* genericSchema() {
  static const SecretSchema schema = {"org.freedesktop.Secret.Generic",
                                      SECRET_SCHEMA_DONT_MATCH_NAME,
                                      {{"service", SECRET_SCHEMA_ATTRIBUTE_STRING},
                                       {"account", SECRET_SCHEMA_ATTRIBUTE_STRING},
                                       {nullptr, SECRET_SCHEMA_ATTRIBUTE_STRING}},
                                      0,
                                      nullptr,
                                      nullptr,
                                      nullptr,
                                      nullptr,
                                      nullptr,
                                      nullptr,
                                      nullptr};
  return &schema;
}

// libsecret keeps one connection to the service per process; dropping it
// after each use lets the next lookup find the service on whatever bus is
// current (and keeps no connection across a fork).
struct DisconnectAfterUse {
  ~DisconnectAfterUse() { secret_service_disconnect(); }
};

void explain(GError* error, std::string* why, const char* fallback) {
  if (why) *why = error ? error->message : fallback;
  if (error) g_error_free(error);
}

}  // namespace

std::optional<std::string> findGenericPassword(const std::string& service,
                                               const std::string& account, std::string* why) {
  DisconnectAfterUse disconnect;
  GError* error = nullptr;
  gchar* password =
      secret_password_lookup_sync(genericSchema(), nullptr, &error, "service", service.c_str(),
                                  "account", account.c_str(), nullptr);
  if (!password) {
    explain(error, why, "no such item");
    return std::nullopt;
  }
  std::string out = password;
  secret_password_free(password);
  if (error) g_error_free(error);
  return out;
}

bool storeGenericPassword(const std::string& service, const std::string& account,
                          const std::string& label, const std::string& password, std::string* why) {
  DisconnectAfterUse disconnect;
  GError* error = nullptr;
  gboolean ok = secret_password_store_sync(
      genericSchema(), SECRET_COLLECTION_DEFAULT, label.c_str(), password.c_str(), nullptr, &error,
      "service", service.c_str(), "account", account.c_str(), nullptr);
  if (!ok)
    explain(error, why, "the item could not be stored");
  else if (error)
    g_error_free(error);
  return ok;
}

}  // namespace vtc::secrets
