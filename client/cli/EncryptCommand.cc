// `encrypt`: an account in the clear turned over to encryption with one
// compaction. Everything on the share is taken in first; then the account
// key is made and stored wrapped on the share, this computer's name is
// sealed in its record, and each dataclass's whole truth goes out sealed as
// a reset that replaces its history (the plain changelogs are deleted).
// The other computers stop with a sentence until they run setup again with
// the passphrase.
#include "VantorSyncManager/VTCPrefsCenter.h"
#include "client/cli/Commands.h"
#include "client/cli/Terminal.h"
#include "client/run/Account.h"
#include "client/run/AccountKey.h"
#include "client/run/SyncFailure.h"
#include "client/run/SyncRun.h"
#include "common/SecretMemory.h"
#include "platform/sealing/KeyRecord.h"

namespace vtc::client {

int encryptCommand(const std::optional<std::string>& passphraseCommand, Output& output) {
  if (accountEncrypted())
    throw SyncFailure(FailureKind::Usage, "This computer's account is encrypted already.");
  VTCPrefsCenter& prefs = VTCPrefsCenter::defaultCenter();
  // Whatever the share holds is taken in while it can still be read.
  const RunResult first = runSync(RunRequest{});
  if (!first.failures.empty())
    throw SyncFailure(first.failures.front().kind,
                      "The account was not encrypted: " + first.failures.front().sentence);

  const SecretHold holding;
  const auto [member, password] = storedCredentials();
  auto session = openSession(member, password, prefs.configuration());
  if (readKeyRecord(*session))
    throw SyncFailure(FailureKind::Usage,
                      "Another computer encrypted the account already; run `nubilosyncclient "
                      "setup` again to give this one the passphrase.");
  std::string passphrase = readPassphrase(passphraseCommand, true);
  sealing::SecretKey key = sealing::SecretKey::random();
  const Dictionary record = sealing::wrapKey(key, passphrase);
  wipe(passphrase);
  writeKeyRecord(*session, record);
  storeAccountKey(member, key, passwordCommandStored());
  const sealing::AccountSeal seal(std::move(key));
  session->patchClientInfo(Dictionary{
      {"clientname", seal.sealText(prefs.clientName().value_or(""), sealing::kClientNamePurpose)}});
  session.reset();

  RunRequest compaction;
  compaction.repair = true;
  const RunResult sealed = runSync(compaction);
  if (!sealed.failures.empty())
    throw SyncFailure(sealed.failures.front().kind,
                      "The account's key is made, but not every dataclass was written again "
                      "encrypted; run `nubilosyncclient repair NAME` for it: " +
                          sealed.failures.front().sentence);
  if (output.verbosity > 0)
    output.out << "The account of " << member
               << " is encrypted: its data on the share was written again as ciphertext. Run "
                  "`nubilosyncclient setup` again on each other computer to give it the "
                  "passphrase.\n";
  return 0;
}

}  // namespace vtc::client
