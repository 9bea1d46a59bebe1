// The one way the library reaches systemd's user manager: `systemctl --user`
// with some arguments. Tests install a recorder in its place; a separate
// program can be given another `systemctl` through PATH.
#pragma once

#include <string>
#include <vector>

#include "common/Seam.h"
#include "platform/process/Command.h"

namespace vtc::jobs {

using SystemctlCall = process::CommandResult(const std::vector<std::string>& arguments);

// Empty: run the real `systemctl --user`.
Seam<SystemctlCall>& systemctlSeam();

// Runs `systemctl --user <arguments>` (or what the seam holds).
process::CommandResult systemctl(const std::vector<std::string>& arguments);

// "systemctl --user ARGS: what it said (status N)", for error messages.
std::string describeFailure(const std::vector<std::string>& arguments,
                            const process::CommandResult& result);

}  // namespace vtc::jobs
