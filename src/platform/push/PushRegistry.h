// What this user registered with the push service, kept as the property
// list "PushRegistrations.plist" in the support folder: the launchables (a
// program and its arguments to run when a message arrives on a topic) and
// the accounts whose session opens at login. Writers replace the file
// whole; the commands that write it are run one at a time by the user.
#pragma once

#include <optional>
#include <string>
#include <vector>

namespace vtc::push {

struct Launchable {
  std::string tool;
  std::string topic;
  std::vector<std::string> arguments;
};

struct OnLoadSession {
  std::string account;
  std::string domain;
  std::string accountPlaceholder;
  std::string service;
};

struct Registrations {
  std::vector<Launchable> launchables;
  std::vector<OnLoadSession> onLoadSessions;
};

// The file, or none without a support folder.
std::optional<std::string> registrationsFile();

// The registrations (empty when the file is absent); none when there is no
// support folder or the file is not a property list.
std::optional<Registrations> readRegistrations();

// False when the file could not be written; it is then unchanged.
bool writeRegistrations(const Registrations& registrations);

}  // namespace vtc::push
