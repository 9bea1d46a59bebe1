// The older scheduler: cron. An action of a domain is a line of the user's
// crontab tagged "# <domain> <action>" at its end. Without a crontab
// program there is no older scheduler and nothing to remove.
#pragma once

#include <string>
#include <vector>

#include "common/Seam.h"
#include "platform/process/Command.h"

namespace vtc::jobs {

using CrontabCall = process::CommandResult(const std::vector<std::string>& arguments,
                                           const std::string& input);

// Empty: run the real `crontab`.
Seam<CrontabCall>& crontabSeam();

// The tag that ends the line of an action.
std::string scheduledActionTag(const std::string& domain, const std::string& action);

// Removes the lines of the action from the user's crontab, keeping every
// other line as it is. True when none is left (also when there was none, or
// no crontab at all); false with a sentence in error when the crontab could
// not be read or written.
bool removeScheduledAction(const std::string& domain, const std::string& action,
                           std::string& error);

}  // namespace vtc::jobs
