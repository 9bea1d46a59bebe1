// This computer's identifiers: the machine id that names per-host files, and
// the host UUID that identifies it in sync reports.
#pragma once

#include <optional>
#include <string>

namespace vtc::os {

// /etc/machine-id, 32 lower-case hex digits; empty when unreadable. The
// environment variable NUBILO_MACHINE_ID_FILE names another file, for homes
// on one machine that stand for computers of their own (demo, tests); the
// host UUID then comes from it too.
std::string machineId();

// The host's hardware UUID in upper-case 8-4-4-4-12 text: the firmware's
// product UUID where it is readable (usually only by root), else the machine
// id in UUID form. None, with the errno of the failed read in error, when
// neither can be read.
std::optional<std::string> hostUUID(int& error);

// Reads other files instead of the system's; empty restores them (tests).
void setIdentityFilesForTesting(std::string productUuidFile, std::string machineIdFile);

}  // namespace vtc::os
