// The sync client's commands. Each returns the process's exit status and
// writes its output to out; failures raise SyncFailure.
#pragma once

#include <iosfwd>
#include <optional>
#include <string>
#include <vector>

#include "client/run/SyncRun.h"

namespace vtc::client {

struct Output {
  std::ostream& out;
  std::ostream& err;
  int verbosity = 1;      // 0 quiet, 1 normal, 2 verbose
  bool terminal = false;  // standard output is a terminal: progress and a line per dataclass
};

struct SetupRequest {
  std::string url;
  std::string member;
  std::optional<std::string> passwordCommand;
  bool passwordFromStdin = false;
  std::optional<std::string> caFile;      // an authority's certificate to trust (HTTPS)
  std::optional<std::string> pushServer;  // mqtt[s]://host[:port], stored once setup succeeds
  bool allowInsecure = false;             // the password may cross plain http:// or mqtt://
  bool newArea = false;  // start a new sync area where none was expected, without asking
  // A new account's data is encrypted (a joining computer follows the
  // share: an area with a key record is encrypted).
  bool encrypt = false;
  // Prints the passphrase (else it is read like the password); used at
  // setup only.
  std::optional<std::string> passphraseCommand;
};

// `passphrase`: rewraps the account key with a new passphrase; the data
// stays as it is.
int passphraseCommand(Output& output);
// `encrypt`: turns this computer's account in the clear over to encryption
// with one compaction of each dataclass.
int encryptCommand(const std::optional<std::string>& passphraseCommand, Output& output);

int setupCommand(const SetupRequest& request, Output& output);
int addCommand(const std::string& kind, const std::string& folder,
               const std::optional<std::string>& dataclass, Output& output);
int removeCommand(const std::string& dataclass, Output& output);
int syncCommand(RunRequest request, Output& output);
// action: "" (list), "restore" or "drop", with the conflict id.
int conflictsCommand(const std::string& action, const std::string& id, Output& output);
int statusCommand(bool json, Output& output);
int scheduleCommand(bool on, const std::optional<std::string>& every, Output& output);
int pushCommand(bool on, Output& output);
// action: "" (list every setting), "get" or "set".
int configCommand(const std::string& action, const std::string& name, const std::string& value,
                  Output& output);
// Where the log is, as a user would type it.
std::string logFileShown();
std::string configuredLogLevel();
int forgetCommand(const std::string& computer, bool force, Output& output);
// Runs until SIGTERM or SIGINT.
int listenCommand(Output& output);

// The whole command line; the entry point of nubilosyncclient.
int runCommandLine(int argc, char** argv);

}  // namespace vtc::client
