// This computer's identifiers: the machine id that names per-host files, and
// the host UUID that identifies it in sync reports.
#pragma once

#include <optional>
#include <string>

namespace vtc::os {

// /etc/machine-id, 32 lower-case hex digits; empty when unreadable. The
// environment variable NUBILO_MACHINE_ID_FILE names another file, for homes
// on one machine that stand for computers of their own (demo, tests); the
// host UUID then comes from it too. It names per-host files here only.
std::string machineId();

// This computer's UUID for the share, in upper-case 8-4-4-4-12 text: the
// machine id keyed with this application's own id, the way
// sd_id128_get_machine_app_specific derives it (an HMAC-SHA256), so that it
// is stable here and tells nothing of the machine id elsewhere; the machine
// id itself never leaves the computer. None, with the errno of the failure
// in error, when the machine id cannot be read.
std::optional<std::string> hostUUID(int& error);

// Reads another machine-id file instead of the system's; empty restores it
// (tests).
void setIdentityFileForTesting(std::string machineIdFile);

}  // namespace vtc::os
