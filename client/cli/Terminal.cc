#include "client/cli/Terminal.h"

#include <termios.h>
#include <unistd.h>

#include <cstdio>
#include <iostream>

#include "client/run/AccountKey.h"
#include "client/run/SyncFailure.h"
#include "common/SecretMemory.h"

namespace vtc::client {

std::optional<std::string> readPassword(const std::string& prompt) {
  const bool terminal = ::isatty(STDIN_FILENO);
  termios saved{};
  if (terminal) {
    std::fprintf(stderr, "%s", prompt.c_str());
    std::fflush(stderr);
    ::tcgetattr(STDIN_FILENO, &saved);
    termios quiet = saved;
    quiet.c_lflag &= ~static_cast<tcflag_t>(ECHO);
    ::tcsetattr(STDIN_FILENO, TCSAFLUSH, &quiet);
  }
  std::string line;
  const bool read = static_cast<bool>(std::getline(std::cin, line));
  if (terminal) {
    ::tcsetattr(STDIN_FILENO, TCSAFLUSH, &saved);
    std::fprintf(stderr, "\n");
  }
  if (!read) return std::nullopt;
  if (!line.empty() && line.back() == '\r') line.pop_back();
  return line;
}

std::string readPassphrase(const std::optional<std::string>& command, bool fresh) {
  if (command) return passphraseFromCommand(*command);
  auto typed = readPassword(fresh ? "New passphrase for the account's encryption: "
                                  : "Passphrase of the account's encryption: ");
  if (!typed || typed->empty()) throw SyncFailure(FailureKind::Usage, "No passphrase was given.");
  if (fresh) {
    auto again = readPassword("The same passphrase again: ");
    const bool same = again && *again == *typed;
    if (again) wipe(*again);
    if (!same) {
      wipe(*typed);
      throw SyncFailure(FailureKind::Usage, "The two passphrases differ; nothing was changed.");
    }
  }
  return *typed;
}

bool confirm(const std::string& question) {
  std::fprintf(stderr, "%s", question.c_str());
  std::fflush(stderr);
  std::string line;
  return std::getline(std::cin, line) && !line.empty() && (line[0] == 'y' || line[0] == 'Y');
}

}  // namespace vtc::client
