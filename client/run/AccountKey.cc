#include "client/run/AccountKey.h"

#include "VantorSyncManager/PublicNames.h"
#include "VantorSyncManager/StringAdditions.h"
#include "client/run/Account.h"
#include "client/run/SyncFailure.h"
#include "common/Format.h"
#include "common/SecretMemory.h"
#include "platform/dav/TesselSession.h"
#include "platform/plist/PlistCodec.h"
#include "platform/prefs/PreferenceStore.h"
#include "platform/sealing/KeyRecord.h"
#include "platform/secrets/CredentialStore.h"
#include "prefs/ClientConfiguration.h"

namespace vtc::client {

namespace {

using prefs::PreferenceStore;
using prefs::Scope;

constexpr const char* kKeyService = "NubiloAccountKey";
constexpr const char* kKeyRecordName = "AccountKey.plist";
// A key record is a few hundred bytes; anything much larger is not one.
constexpr size_t kLargestKeyRecord = 16 * 1024;

std::string keyRecordPath(const NubiloRemoteSession& session) {
  return stringByAppendingTesselPathComponent(session.syncPath(), kKeyRecordName);
}

Value perUser(const std::string& key) {
  return PreferenceStore::shared().copyValue(key, kVantorDefaultsKey, Scope::AnyHost);
}

}  // namespace

std::optional<Dictionary> readKeyRecord(NubiloRemoteSession& session) {
  DavTransaction got = session.tesselSession().getDataAtPath(keyRecordPath(session));
  if (got.httpStatusCode() == 404) return std::nullopt;
  if (!got.isSuccessful() || got.result().kind() != Value::Kind::Data)
    throw SyncFailure(
        FailureKind::Other,
        format("The account's key record could not be read from the share (%@).", got));
  const Bytes& bytes = got.result().data();
  std::optional<Value> record;
  if (bytes.size() <= kLargestKeyRecord) record = plist::parse(bytes);
  if (!record || !record->isDictionary())
    throw SyncFailure(FailureKind::Other,
                      "The account's key record on the share is damaged; a computer of the "
                      "account can write it again with `nubilosyncclient passphrase`.");
  return record->dictionary();
}

void writeKeyRecord(NubiloRemoteSession& session, const Dictionary& record) {
  const std::string xml = plist::toXml(Value(record));
  DavTransaction put =
      session.putDataWithRetry(Bytes(xml.begin(), xml.end()), keyRecordPath(session));
  if (!put.isSuccessful())
    throw SyncFailure(FailureKind::Other,
                      format("The share did not take the account's key record (%@).", put));
}

sealing::SecretKey unwrapWithPassphrase(const Dictionary& record, const std::string& passphrase) {
  std::optional<sealing::SecretKey> key;
  try {
    key = sealing::unwrapKey(record, passphrase);
  } catch (const std::runtime_error& e) {
    throw SyncFailure(FailureKind::Other, e.what());
  }
  if (!key)
    throw SyncFailure(FailureKind::Login,
                      "That passphrase does not open this account's key; nothing was changed. "
                      "Use the passphrase the account was set up with (or last changed to).");
  return std::move(*key);
}

std::string passphraseFromCommand(const std::string& command) {
  try {
    return passwordFromCommand(command);
  } catch (const SyncFailure&) {
    throw SyncFailure(FailureKind::Login,
                      "The passphrase command failed or printed nothing; check it, then run "
                      "`nubilosyncclient setup` again with --passphrase-command CMD.");
  }
}

void storeAccountKey(const std::string& member, const sealing::SecretKey& key,
                     const std::optional<std::string>& passphraseCommand) {
  auto& store = PreferenceStore::shared();
  if (!passphraseCommand) {
    std::string text = key.toText();
    std::string why;
    const bool stored =
        secrets::storeGenericPassword(kKeyService, member, "Nubilo account key", text, &why);
    wipe(text);
    if (!stored)
      throw SyncFailure(FailureKind::Other,
                        "The account's key could not be stored in the Secret Service (" + why +
                            "); on a computer without one, give --passphrase-command CMD.");
  }
  store.setValue(kPassphraseCommandKey, passphraseCommand ? Value(*passphraseCommand) : Value(),
                 kVantorDefaultsKey, Scope::AnyHost);
  store.setValue(kEncryptedAccountKey, Value(true), kVantorDefaultsKey, Scope::AnyHost);
  store.synchronize(kVantorDefaultsKey, Scope::AnyHost);
}

void forgetAccountKey() {
  auto& store = PreferenceStore::shared();
  store.setValue(kPassphraseCommandKey, Value(), kVantorDefaultsKey, Scope::AnyHost);
  store.setValue(kEncryptedAccountKey, Value(), kVantorDefaultsKey, Scope::AnyHost);
  store.synchronize(kVantorDefaultsKey, Scope::AnyHost);
}

bool accountEncrypted() {
  const Value v = perUser(kEncryptedAccountKey);
  return v.kind() == Value::Kind::Boolean && v.boolean();
}

std::shared_ptr<const sealing::AccountSeal> accountSeal(NubiloRemoteSession& session,
                                                        const std::string& member) {
  if (!accountEncrypted()) return nullptr;
  const SecretHold holding;
  const Value command = perUser(kPassphraseCommandKey);
  if (command.isString() && !command.string().empty()) {
    std::string passphrase = passphraseFromCommand(command.string());
    std::optional<Dictionary> record = readKeyRecord(session);
    if (!record) {
      wipe(passphrase);
      throw SyncFailure(FailureKind::Login,
                        "The share holds no key for this encrypted account; nothing is sent "
                        "until it does (was the sync area replaced?).");
    }
    try {
      sealing::SecretKey key = unwrapWithPassphrase(*record, passphrase);
      wipe(passphrase);
      return std::make_shared<const sealing::AccountSeal>(std::move(key));
    } catch (const SyncFailure& e) {
      wipe(passphrase);
      if (e.kind() != FailureKind::Login) throw;
      throw SyncFailure(FailureKind::Login,
                        "The passphrase that the passphrase command prints does not open this "
                        "account's key; if it was changed on another computer, change the "
                        "command to print the new one.");
    }
  }
  std::string why;
  std::optional<std::string> text = secrets::findGenericPassword(kKeyService, member, &why);
  std::optional<sealing::SecretKey> key;
  if (text) key = sealing::SecretKey::fromText(*text);
  if (text) wipe(*text);
  if (!key)
    throw SyncFailure(FailureKind::Login,
                      "This account is encrypted and its key is not in the Secret Service" +
                          (why.empty() ? std::string() : " (" + why + ")") +
                          "; run `nubilosyncclient setup " + storedServerURL() + " --user " +
                          member + "` again to give the passphrase.");
  return std::make_shared<const sealing::AccountSeal>(std::move(*key));
}

}  // namespace vtc::client
