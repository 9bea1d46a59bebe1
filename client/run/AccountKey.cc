#include "client/run/AccountKey.h"

#include <unistd.h>
#include "VantorSyncManager/PublicNames.h"
#include "VantorSyncManager/StringAdditions.h"

#include <filesystem>
#include <fstream>

#include "client/run/Account.h"
#include "client/run/SupportFolder.h"
#include "client/run/SyncFailure.h"
#include "common/Format.h"
#include "common/SecretMemory.h"
#include "platform/dav/TesselSession.h"
#include "platform/fs/AtomicWrite.h"
#include "platform/fs/LocalPaths.h"
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

// Beside a password command: only the user reads it.
std::string keyFilePath() {
  return paths::join(supportFolder(), "AccountKey");
}

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
                     bool besidePasswordCommand) {
  std::string text = key.toText();
  std::string why;
  bool stored = false;
  if (besidePasswordCommand) {
    std::error_code ignored;  // a folder that cannot be made fails the write
    std::filesystem::create_directories(supportFolder(), ignored);
    stored = fs::writeFileAtomically(keyFilePath(), text + "\n", 0600);
    why = "the key file " + keyFilePath() + " could not be written";
  } else {
    stored = secrets::storeGenericPassword(kKeyService, member, "Nubilo account key", text, &why);
    why = "the Secret Service: " + why;
  }
  wipe(text);
  if (!stored)
    throw SyncFailure(FailureKind::Other, "The account's key could not be stored (" + why + ").");
  auto& store = PreferenceStore::shared();
  store.setValue(kEncryptedAccountKey, Value(true), kVantorDefaultsKey, Scope::AnyHost);
  store.synchronize(kVantorDefaultsKey, Scope::AnyHost);
}

void forgetAccountKey() {
  ::unlink(keyFilePath().c_str());
  auto& store = PreferenceStore::shared();
  store.setValue(kEncryptedAccountKey, Value(), kVantorDefaultsKey, Scope::AnyHost);
  store.synchronize(kVantorDefaultsKey, Scope::AnyHost);
}

bool accountEncrypted() {
  const Value v = perUser(kEncryptedAccountKey);
  return v.kind() == Value::Kind::Boolean && v.boolean();
}

std::shared_ptr<const sealing::AccountSeal> accountSeal(const std::string& member) {
  if (!accountEncrypted()) return nullptr;
  const SecretHold holding;
  std::string why;
  std::optional<std::string> text;
  if (passwordCommandStored()) {
    std::ifstream in(keyFilePath());
    std::string line;
    if (std::getline(in, line)) text = std::move(line);
    why = "no key file " + keyFilePath();
  } else {
    text = secrets::findGenericPassword(kKeyService, member, &why);
    why = "not in the Secret Service: " + why;
  }
  std::optional<sealing::SecretKey> key;
  if (text) key = sealing::SecretKey::fromText(*text);
  if (text) wipe(*text);
  if (!key)
    throw SyncFailure(FailureKind::Login, "This account is encrypted and its key is missing (" +
                                              why + "); run `nubilosyncclient setup " +
                                              storedServerURL() + " --user " + member +
                                              "` again to give the passphrase.");
  return std::make_shared<const sealing::AccountSeal>(std::move(*key));
}

}  // namespace vtc::client
