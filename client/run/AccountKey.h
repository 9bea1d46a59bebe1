// An encrypted account's key on this computer: made by the first computer
// at setup, wrapped with the passphrase on the share ("AccountKey.plist" in
// the sync area), and kept here in the Secret Service, or, on a computer
// that reads its password from a command, beside what that command reads:
// in a file of the support folder only the user can read. A passphrase is
// never an argument and never logged; callers wipe theirs (vtc::wipe) once
// used.
#pragma once

#include <memory>
#include <optional>
#include <string>

#include "VantorSyncManager/NubiloRemoteSession.h"
#include "platform/sealing/AccountSeal.h"
#include "platform/sealing/SecretKey.h"

namespace vtc::client {

// The per-user preference that says this computer's account is encrypted.
inline constexpr const char* kEncryptedAccountKey = "AccountEncrypted";

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

// Keeps the key for later syncs: in the key file when this computer reads
// its password from a command (besidePasswordCommand), else in the Secret
// Service. Marks the account encrypted. Raises SyncFailure when it cannot.
void storeAccountKey(const std::string& member, const sealing::SecretKey& key,
                     bool besidePasswordCommand);

// A plain account from now on: the preferences of an earlier encrypted one
// go.
void forgetAccountKey();

// Whether this computer's account is encrypted.
bool accountEncrypted();

// The seal of this computer's account (nullptr for a plain one), from the
// key file or the Secret Service. Raises SyncFailure (Login) with a
// sentence saying what to do.
std::shared_ptr<const sealing::AccountSeal> accountSeal(const std::string& member);

}  // namespace vtc::client
