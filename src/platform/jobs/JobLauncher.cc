#include "platform/jobs/JobLauncher.h"

#include <unistd.h>

#include <optional>

#include "platform/fs/AtomicWrite.h"
#include "platform/fs/LocalPaths.h"
#include "platform/jobs/UnitFiles.h"
#include "platform/jobs/UserManager.h"

namespace vtc::jobs {

namespace {

bool call(const std::vector<std::string>& arguments, std::string& error) {
  process::CommandResult result = systemctl(arguments);
  if (result.status == 0) return true;
  if (error.empty()) error = describeFailure(arguments, result);
  return false;
}

}  // namespace

bool jobSubmit(const Dictionary& description, std::string& error) {
  error.clear();
  std::optional<JobUnits> units = unitsForJob(description, error);
  if (!units) return false;
  const std::string folder = unitsFolder();
  if (!paths::makeDirectories(folder)) {
    error = "cannot create " + folder;
    return false;
  }
  // A unit the new description no longer has (a timer whose calendar was
  // dropped) must not outlive it.
  for (const std::string& name : unitNames(description.get("Label").string())) {
    bool kept = false;
    for (const UnitFile& file : units->files) kept = kept || file.name == name;
    if (!kept) ::unlink(paths::join(folder, name).c_str());
  }
  for (const UnitFile& file : units->files) {
    if (!fs::writeFileAtomically(paths::join(folder, file.name), file.text)) {
      error = "cannot write " + paths::join(folder, file.name);
      return false;
    }
  }
  if (!call({"daemon-reload"}, error)) return false;
  if (units->enabled.empty()) return true;
  // Enabled by path: a manager whose own configuration folder is elsewhere
  // links them in. The start is queued, not waited for: a job that runs at
  // load (a whole sync) never runs in the caller, and its failure is no
  // failure to submit it.
  std::vector<std::string> enable{"enable", "--now", "--no-block"};
  for (const std::string& name : units->enabled) enable.push_back(paths::join(folder, name));
  return call(enable, error);
}

bool jobRemove(const std::string& label, bool wait, std::string& error) {
  error.clear();
  const std::string folder = unitsFolder();
  std::vector<std::string> present;
  for (const std::string& name : unitNames(label))
    if (::access(paths::join(folder, name).c_str(), F_OK) == 0) present.push_back(name);
  if (present.empty()) return true;
  std::vector<std::string> disable{"disable", "--now"};
  if (!wait) disable.push_back("--no-block");
  disable.insert(disable.end(), present.begin(), present.end());
  bool ok = call(disable, error);
  for (const std::string& name : present) ::unlink(paths::join(folder, name).c_str());
  return call({"daemon-reload"}, error) && ok;
}

}  // namespace vtc::jobs
