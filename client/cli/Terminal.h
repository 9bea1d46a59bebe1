// Reading a password: from the terminal without echo, or the first line of
// standard input when it is not a terminal; and asking a yes-or-no question
// at a terminal.
#pragma once

#include <optional>
#include <string>

namespace vtc::client {

// Prompts on standard error when standard input is a terminal. None when
// nothing could be read.
std::optional<std::string> readPassword(const std::string& prompt);

// An encrypted account's passphrase: the first line the command prints, or
// else read as a password; a new one (fresh) is asked twice. Raises
// SyncFailure when none is given or the two differ. The caller holds it
// undumpable and wipes it after use.
std::string readPassphrase(const std::optional<std::string>& command, bool fresh);

// Asks on standard error and reads the answer from standard input (a
// terminal): true for an answer that begins with "y" or "Y".
bool confirm(const std::string& question);

}  // namespace vtc::client
