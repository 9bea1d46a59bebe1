// An encrypted account's key on this computer: made by the first computer
// at setup, wrapped with the passphrase on the share ("AccountKey.plist" in
// the sync area), and kept here in the Secret Service, or, beside a
// password command, unwrapped at each sync from what a passphrase command
// prints. A passphrase is never an argument and never logged; callers wipe
// theirs (vtc::wipe) once used.
#pragma once

#include <memory>
#include <optional>
#include <string>

#include "VantorSyncManager/NubiloRemoteSession.h"
#include "platform/sealing/AccountSeal.h"
#include "platform/sealing/SecretKey.h"

namespace vtc::client {

// Per-user preferences: whether this computer's account is encrypted, and
// the command that prints its passphrase (absent: the key is in the Secret
// Service).
inline constexpr const char* kEncryptedAccountKey = "AccountEncrypted";
inline constexpr const char* kPassphraseCommandKey = "PassphraseCommand";

// The share's wrapped key record, or nullopt when the area has none (a
// plain account). Raises SyncFailure when the share cannot be asked or the
// record is not a property list.
std::optional<Dictionary> readKeyRecord(NubiloRemoteSession& session);
// Stores the record; raises SyncFailure when the share refuses it.
void writeKeyRecord(NubiloRemoteSession& session, const Dictionary& record);

// The account key inside record, or a SyncFailure (Login) whose sentence
// says the passphrase does not open it and that nothing was changed.
sealing::SecretKey unwrapWithPassphrase(const Dictionary& record, const std::string& passphrase);

// The first line the command prints; raises SyncFailure (Login).
std::string passphraseFromCommand(const std::string& command);

// Keeps the key for later syncs: with a passphrase command, the command in
// the preferences (the key itself is kept nowhere); else in the Secret
// Service. Marks the account encrypted. Raises SyncFailure when it cannot.
void storeAccountKey(const std::string& member, const sealing::SecretKey& key,
                     const std::optional<std::string>& passphraseCommand);

// A plain account from now on: the preferences of an earlier encrypted one
// go.
void forgetAccountKey();

// Whether this computer's account is encrypted.
bool accountEncrypted();

// The seal of this computer's account (nullptr for a plain one), from the
// Secret Service or the passphrase command and the share's record. Raises
// SyncFailure (Login) with a sentence saying what to do.
std::shared_ptr<const sealing::AccountSeal> accountSeal(NubiloRemoteSession& session,
                                                        const std::string& member);

}  // namespace vtc::client
