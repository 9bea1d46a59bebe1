// The per-user job launcher on systemd: a job description becomes user
// units under unitsFolder(), enabled and started by the user manager.
// Without a user manager (a container, a bare SSH login) the units are
// still written, and the calls report the manager's refusal as an error.
#pragma once

#include <string>

#include "VantorSyncManager/Value.h"

namespace vtc::jobs {

// Writes the description's units, reloads the user manager and enables them
// with their start queued (`enable --now --no-block`): the job never runs in
// the caller, and how it ends is no part of the answer. On failure error
// holds a sentence and false is returned; units already written stay.
bool jobSubmit(const Dictionary& description, std::string& error);

// Disables and stops the label's units (waiting for them to stop unless
// wait is false), deletes them and reloads the manager. A label with no
// units is already removed. The units are deleted even when the manager
// refuses; false and error then say so.
bool jobRemove(const std::string& label, bool wait, std::string& error);

}  // namespace vtc::jobs
