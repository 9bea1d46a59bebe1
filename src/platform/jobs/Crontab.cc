#include "platform/jobs/Crontab.h"

#include <sstream>

namespace vtc::jobs {

namespace {

process::CommandResult crontab(const std::vector<std::string>& arguments,
                               const std::string& input) {
  if (auto replacement = crontabSeam().current()) return replacement(arguments, input);
  std::vector<std::string> argv{"crontab"};
  argv.insert(argv.end(), arguments.begin(), arguments.end());
  return process::run(argv, input);
}

std::string trimmed(std::string text) {
  while (!text.empty() && (text.back() == ' ' || text.back() == '\t' || text.back() == '\r'))
    text.pop_back();
  return text;
}

}  // namespace

Seam<CrontabCall>& crontabSeam() {
  static Seam<CrontabCall> seam;
  return seam;
}

std::string scheduledActionTag(const std::string& domain, const std::string& action) {
  return "# " + domain + " " + action;
}

bool removeScheduledAction(const std::string& domain, const std::string& action,
                           std::string& error) {
  process::CommandResult listed = crontab({"-l"}, {});
  // No crontab program: no older scheduler. A user without a crontab gets a
  // failure status and nothing on standard output.
  if (listed.status == 127 || (listed.status != 0 && listed.out.empty())) return true;
  if (listed.status != 0) {
    error = "crontab -l failed (status " + std::to_string(listed.status) + ")";
    return false;
  }
  const std::string tag = scheduledActionTag(domain, action);
  std::istringstream lines(listed.out);
  std::string kept;
  bool removed = false;
  for (std::string line; std::getline(lines, line);) {
    if (trimmed(line).ends_with(tag)) {
      removed = true;
      continue;
    }
    kept += line + "\n";
  }
  if (!removed) return true;
  process::CommandResult written = crontab({"-"}, kept);
  if (written.status == 0) return true;
  error = "crontab - failed: " + trimmed(written.err) + " (status " +
          std::to_string(written.status) + ")";
  return false;
}

}  // namespace vtc::jobs
