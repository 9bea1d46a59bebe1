#include "platform/jobs/UserManager.h"

namespace vtc::jobs {

Seam<SystemctlCall>& systemctlSeam() {
  static Seam<SystemctlCall> seam;
  return seam;
}

process::CommandResult systemctl(const std::vector<std::string>& arguments) {
  if (auto replacement = systemctlSeam().current()) return replacement(arguments);
  std::vector<std::string> argv{"systemctl", "--user"};
  argv.insert(argv.end(), arguments.begin(), arguments.end());
  return process::run(argv);
}

std::string describeFailure(const std::vector<std::string>& arguments,
                            const process::CommandResult& result) {
  std::string text = "systemctl --user";
  for (const std::string& a : arguments) text += " " + a;
  std::string said = result.err.empty() ? result.out : result.err;
  while (!said.empty() && (said.back() == '\n' || said.back() == ' ')) said.pop_back();
  if (result.status == 127 && said.empty()) said = "systemctl could not be started";
  return text + ": " + said + " (status " + std::to_string(result.status) + ")";
}

}  // namespace vtc::jobs
