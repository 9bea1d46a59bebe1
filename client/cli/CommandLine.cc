// The command line of nubilosyncclient. Its commands, options and exit
// statuses are a contract: scripts, jobs and pushes call them as they are.
#include <CLI/CLI.hpp>

#include <cstdlib>
#include <iostream>
#include <thread>

#include "VantorSyncManager/NubiloException.h"
#include "client/cli/Commands.h"
#include "client/run/SyncFailure.h"
#include "common/Clock.h"

namespace vtc::client {

namespace {

// NUBILO_WAIT_SCALE multiplies every wait of the protocol (lock back-off,
// the pause before asking again for a missing file): tests that run the
// client as a program make its waits short with it.
class ScaledSleeper : public Sleeper {
 public:
  explicit ScaledSleeper(double scale) : scale_(scale) {}
  void sleepFor(Seconds duration) override { std::this_thread::sleep_for(duration * scale_); }

 private:
  double scale_;
};

void scaleWaitsFromEnvironment() {
  const char* text = std::getenv("NUBILO_WAIT_SCALE");
  if (!text) return;
  const double scale = std::strtod(text, nullptr);
  if (scale < 0 || scale >= 1) return;
  static ScaledSleeper sleeper(scale);
  installSleeper(&sleeper);
}

}  // namespace

int runCommandLine(int argc, char** argv) {
  scaleWaitsFromEnvironment();
  CLI::App app{
      "Keeps this computer's contacts and calendars (vdir folders) in step with the "
      "other computers of an account, through a WebDAV share.",
      "nubilosyncclient"};
  app.require_subcommand(0, 1);

  bool launchSync = false;
  bool periodic = false;
  std::vector<std::string> launchDataclasses;
  bool quiet = false;
  bool verbose = false;
  app.add_flag("--sync", launchSync, "Sync now (the form jobs and pushes use)");
  app.add_flag("--periodic", periodic, "With --sync: started by the schedule");
  app.add_option("--dataclasses", launchDataclasses, "With --sync: only these, comma-separated")
      ->delimiter(',');
  app.add_flag("-q,--quiet", quiet, "Print nothing but errors");
  app.add_flag("-v,--verbose", verbose, "Say more");

  SetupRequest setup;
  std::string passwordCommand;
  auto* setupCommandLine = app.add_subcommand("setup", "Set up the account on this computer");
  setupCommandLine->add_option("URL", setup.url, "http[s]://host[:port][/path] of the share")
      ->required();
  setupCommandLine->add_option("--user", setup.member, "The member name")->required();
  setupCommandLine->add_option("--password-command", passwordCommand,
                               "A command whose first output line is the password");
  setupCommandLine->add_option("--ca-file", setup.caFile,
                               "The certificate (PEM) of the authority of an HTTPS server");

  std::string kind, folder, dataclass;
  auto* add = app.add_subcommand("add", "Sync a vdir folder of contacts or calendars");
  add->add_option("KIND", kind, "contacts or calendars")->required();
  add->add_option("FOLDER", folder, "The vdir folder")->required();
  add->add_option("--dataclass", dataclass, "Its name on the account");

  std::string removed;
  auto* remove = app.add_subcommand("remove", "Stop syncing a folder (its files stay)");
  remove->add_option("NAME", removed, "The dataclass")->required();

  RunRequest run;
  auto* sync = app.add_subcommand("sync", "Sync now");
  sync->add_option("NAME", run.dataclasses, "Only these dataclasses");
  sync->add_flag("--dry-run", run.dryRun, "Say what would happen; change nothing");
  sync->add_option("--max-delete", run.maxDeletePercent,
                   "Refuse to delete more than this percentage of a dataclass's items")
      ->check(CLI::Range(0, 100));

  std::string repaired;
  auto* repair = app.add_subcommand(
      "repair", "Write this computer's copy of a dataclass to the share as its whole history");
  repair->add_option("NAME", repaired, "The dataclass")->required();

  auto* conflicts = app.add_subcommand("conflicts", "List the kept losing values of conflicts");
  auto* status = app.add_subcommand("status", "Say what this computer syncs and how it went");

  try {
    app.parse(argc, argv);
  } catch (const CLI::ParseError& e) {
    const int code = app.exit(e);
    return code == 0 ? 0 : static_cast<int>(FailureKind::Usage);
  }

  Output output{std::cout, std::cerr, quiet ? 0 : (verbose ? 2 : 1)};
  try {
    if (*setupCommandLine) {
      if (!passwordCommand.empty()) setup.passwordCommand = passwordCommand;
      return setupCommand(setup, output);
    }
    if (*add)
      return addCommand(kind, folder,
                        dataclass.empty() ? std::nullopt : std::optional<std::string>(dataclass),
                        output);
    if (*remove) return removeCommand(removed, output);
    if (*sync) return syncCommand(run, output);
    if (*repair) {
      RunRequest request;
      request.dataclasses = {repaired};
      request.repair = true;
      return syncCommand(request, output);
    }
    if (*conflicts) return conflictsCommand(output);
    if (*status) return statusCommand(output);
    if (launchSync) {
      RunRequest launched;
      launched.dataclasses = launchDataclasses;
      launched.periodic = periodic;
      return syncCommand(launched, output);
    }
    std::cout << app.help();
    return static_cast<int>(FailureKind::Usage);
  } catch (const SyncFailure& e) {
    std::cerr << "nubilosyncclient: " << e.what() << "\n";
    return e.exitStatus();
  } catch (const NubiloException& e) {
    std::cerr << "nubilosyncclient: " << e.reason() << "\n";
    return static_cast<int>(FailureKind::Other);
  } catch (const std::exception& e) {
    std::cerr << "nubilosyncclient: " << e.what() << "\n";
    return static_cast<int>(FailureKind::Other);
  }
}

}  // namespace vtc::client
