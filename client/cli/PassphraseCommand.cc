// `passphrase`: the account key wrapped again with a new passphrase. The
// key, and so every changelog on the share, stays as it is; the other
// computers keep their key (a passphrase command there must print the new
// passphrase from now on).
#include "VantorSyncManager/VTCPrefsCenter.h"
#include "client/cli/Commands.h"
#include "client/cli/Terminal.h"
#include "client/run/Account.h"
#include "client/run/AccountKey.h"
#include "client/run/SyncFailure.h"
#include "common/SecretMemory.h"
#include "platform/sealing/KeyRecord.h"

namespace vtc::client {

int passphraseCommand(Output& output) {
  if (!accountEncrypted())
    throw SyncFailure(FailureKind::Usage,
                      "This computer's account is not encrypted; there is no passphrase to "
                      "change.");
  const SecretHold holding;
  const auto [member, password] = storedCredentials();
  auto session = openSession(member, password, VTCPrefsCenter::defaultCenter().configuration());
  std::optional<Dictionary> record = readKeyRecord(*session);
  if (!record)
    throw SyncFailure(FailureKind::Other, "The share holds no key for this encrypted account.");
  std::string old = readPassphrase(std::nullopt, false);
  std::optional<sealing::SecretKey> key;
  try {
    key = unwrapWithPassphrase(*record, old);
  } catch (...) {
    wipe(old);
    throw;
  }
  wipe(old);
  std::string fresh = readPassphrase(std::nullopt, true);
  const Dictionary rewrapped = sealing::wrapKey(*key, fresh);
  wipe(fresh);
  writeKeyRecord(*session, rewrapped);
  if (output.verbosity > 0)
    output.out << "The passphrase of " << member
               << " is changed; a computer that reads it from a passphrase command needs the "
                  "command to print the new one.\n";
  return 0;
}

}  // namespace vtc::client
