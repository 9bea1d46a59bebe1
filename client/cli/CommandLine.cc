// The command line of nubilosyncclient. Its commands, options and exit
// statuses are a contract: scripts, jobs and pushes call them as they are.
#include <CLI/CLI.hpp>

#include <unistd.h>

#include <cstdlib>
#include <iostream>
#include <thread>

#include "VantorSyncManager/NubiloException.h"
#include "client/cli/Commands.h"
#include "client/cli/TerminalText.h"
#include "client/run/Automation.h"
#include "client/run/FailureText.h"
#include "client/run/SyncFailure.h"
#include "common/Clock.h"

namespace vtc::client {

namespace {

#ifndef VSM_CLIENT_VERSION
#define VSM_CLIENT_VERSION "unknown"
#endif
constexpr const char* kClientVersion = VSM_CLIENT_VERSION;

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
  app.fallthrough();  // -q and -v also after the command

  bool launchSync = false;
  bool periodic = false;
  std::vector<std::string> launchDataclasses;
  bool quiet = false;
  bool verbose = false;
  app.add_flag("--sync", launchSync, "Sync now (the form jobs and pushes use)");
  app.add_flag("--periodic", periodic, "With --sync: started by the schedule");
  app.add_option("--dataclasses", launchDataclasses, "With --sync: only these, comma-separated")
      ->delimiter(',');
  app.set_version_flag("--version", "nubilosyncclient " + std::string(kClientVersion));
  app.add_flag("-q,--quiet", quiet, "Print nothing but errors");
  app.add_flag("-v,--verbose", verbose, "Say more: a line per folder and per item synced");

  SetupRequest setup;
  std::string passwordCommand;
  auto* setupCommandLine = app.add_subcommand("setup", "Set up the account on this computer");
  setupCommandLine->add_option("URL", setup.url, "http[s]://host[:port][/path] of the share")
      ->required();
  setupCommandLine->add_option("--user", setup.member, "The member name")->required();
  setupCommandLine->add_option("--password-command", passwordCommand,
                               "A command whose first output line is the password");
  setupCommandLine->add_flag("--password-stdin", setup.passwordFromStdin,
                             "Read the password from standard input (for scripts)");
  setupCommandLine->footer(
      "Example: nubilosyncclient setup https://dav.example.org/sync --user alice");
  std::string pushServer;
  setupCommandLine->add_option("--push", pushServer,
                               "mqtt[s]://host[:port] of the push server (same account)");
  setupCommandLine->add_option("--ca-file", setup.caFile,
                               "The certificate (PEM) of the authority of an HTTPS server");
  setupCommandLine->add_flag("--new", setup.newArea,
                             "Start a new, empty sync area where none is found, without asking");
  setupCommandLine->add_flag("--allow-insecure", setup.allowInsecure,
                             "Send the password over plain http:// or mqtt:// (readable on the "
                             "way)");
  setupCommandLine->add_flag("--encrypt", setup.encrypt,
                             "Encrypt a new account's data: the share holds only ciphertext");
  std::string passphraseCommandLine;
  setupCommandLine->add_option("--passphrase-command", passphraseCommandLine,
                               "A command whose first output line is the encryption passphrase");
  auto* encrypt = app.add_subcommand(
      "encrypt", "Turn the account's data in the clear over to encryption (one compaction)");
  std::string encryptPassphraseCommand;
  encrypt->add_option("--passphrase-command", encryptPassphraseCommand,
                      "A command whose first output line is the new passphrase");
  auto* passphrase = app.add_subcommand(
      "passphrase", "Change the passphrase of an encrypted account (the data stays as it is)");

  std::string kind, folder, dataclass;
  auto* add = app.add_subcommand("add", "Sync a vdir folder of contacts or calendars");
  add->add_option("KIND", kind, "contacts or calendars")->required();
  add->add_option("FOLDER", folder, "The vdir folder")->required();
  add->add_option("--dataclass", dataclass, "Its name on the account");
  add->footer("Example: nubilosyncclient add contacts ~/.local/share/contacts/people");

  std::string removed;
  auto* remove = app.add_subcommand("remove", "Stop syncing a folder (its files stay)");
  remove->add_option("NAME", removed, "The dataclass")->required();
  remove->footer("Example: nubilosyncclient remove com.korvo.Calendars");

  RunRequest run;
  auto* sync = app.add_subcommand("sync", "Sync now");
  sync->add_option("NAME", run.dataclasses, "Only these dataclasses");
  sync->add_flag("--dry-run", run.dryRun, "Say what would happen; change nothing");
  auto* maxDelete =
      sync->add_option("--max-delete", run.maxDeletePercent,
                       "Refuse to delete more than this percentage of a dataclass's items")
          ->check(CLI::Range(0, 100));
  sync->footer("Example: nubilosyncclient sync com.korvo.Contacts --dry-run");

  std::string repaired;
  auto* repair = app.add_subcommand(
      "repair", "Write this computer's copy of a dataclass to the share as its whole history");
  repair->add_option("NAME", repaired, "The dataclass")->required();
  repair->footer("Example: nubilosyncclient repair com.korvo.Contacts");

  auto* conflicts = app.add_subcommand(
      "conflicts", "List conflicts by the item's name, those of the other computers too");
  std::string conflictId;
  auto* restoreConflict =
      conflicts->add_subcommand("restore", "Make a losing value the current one (sent next sync)");
  restoreConflict->add_option("ID", conflictId, "As `conflicts` lists it")->required();
  auto* dropConflict = conflicts->add_subcommand("drop", "Forget a kept losing value");
  bool dropAll = false;
  auto* dropId = dropConflict->add_option("ID", conflictId, "As `conflicts` lists it");
  auto* dropEvery = dropConflict->add_flag("--all", dropAll, "Forget every kept losing value");
  dropId->excludes(dropEvery);
  dropConflict->require_option(1);
  conflicts->footer("Example: nubilosyncclient conflicts restore 2cb0ddcd");
  restoreConflict->footer("Example: nubilosyncclient conflicts restore 2cb0ddcd");
  dropConflict->footer(
      "Examples: nubilosyncclient conflicts drop 2cb0ddcd; nubilosyncclient conflicts drop --all");
  bool statusJson = false;
  auto* status = app.add_subcommand("status", "Say what this computer syncs and how it went");
  status->add_flag("--json", statusJson, "One JSON document, for scripts");
  status->footer("Example: nubilosyncclient status --json");
  app.footer(
      "Examples:\n  nubilosyncclient setup https://dav.example.org/sync --user alice\n"
      "  nubilosyncclient add contacts ~/.local/share/contacts/people\n"
      "  nubilosyncclient sync\n  nubilosyncclient status\n\nSee nubilosyncclient(1).");

  std::string setting, settingValue;
  auto* config = app.add_subcommand("config", "Show or change this computer's settings");
  auto* configGet = config->add_subcommand("get", "Show one setting");
  configGet->add_option("NAME", setting, "name or log-level")->required();
  auto* configSet = config->add_subcommand("set", "Change one setting");
  configSet->add_option("NAME", setting, "name or log-level")->required();
  configSet->add_option("VALUE", settingValue, "Its new value")->required();
  config->footer(
      "Settings:\n  name       this computer's name, as the other computers see it\n"
      "  log-level  error, warn, info or debug\n"
      "Example: nubilosyncclient config set log-level info");

  std::string forgotten;
  bool forceForget = false;
  auto* forget = app.add_subcommand(
      "forget", "Drop a computer that is gone from the account (its record and its locks)");
  forget->add_option("COMPUTER", forgotten, "Its name, as `status` lists it")->required();
  forget->add_flag("--force", forceForget, "Also when it synced within the last week");
  forget->footer("Example: nubilosyncclient forget \"Old laptop\"");

  std::string scheduleSwitch, every;
  auto* schedule = app.add_subcommand("schedule", "Sync by itself on a schedule, or stop");
  schedule->add_option("on|off", scheduleSwitch, "on or off")
      ->required()
      ->check(CLI::IsMember({"on", "off"}));
  schedule->add_option("--every", every, "How often: 30m, 1h, 1d (default: hourly)");
  schedule->footer("Example: nubilosyncclient schedule on --every 1h");

  std::string pushSwitch;
  auto* pushing = app.add_subcommand("push", "Sync as soon as another computer syncs, or stop");
  pushing->add_option("on|off", pushSwitch, "on or off")
      ->required()
      ->check(CLI::IsMember({"on", "off"}));
  pushing->footer("Example: nubilosyncclient push on");
  auto* listen = app.add_subcommand(
      "listen", "Receive pushes and sync on them (`push on` starts this at each login)");
  listen->footer("Example: nubilosyncclient listen");

  try {
    app.parse(argc, argv);
  } catch (const CLI::ParseError& e) {
    const int code = app.exit(e);
    return code == 0 ? 0 : static_cast<int>(FailureKind::Usage);
  }

  Output output{std::cout, std::cerr, quiet ? 0 : (verbose ? 2 : 1), ::isatty(STDOUT_FILENO) == 1};
  try {
    if (*setupCommandLine) {
      if (!passwordCommand.empty()) setup.passwordCommand = passwordCommand;
      if (!pushServer.empty()) setup.pushServer = pushServer;
      if (!passphraseCommandLine.empty()) setup.passphraseCommand = passphraseCommandLine;
      return setupCommand(setup, output);
    }
    if (*add)
      return addCommand(kind, folder,
                        dataclass.empty() ? std::nullopt : std::optional<std::string>(dataclass),
                        output);
    if (*remove) return removeCommand(removed, output);
    if (*sync) {
      // Deletes the user let through go out as confirmed.
      run.deletesConfirmed = maxDelete->count() > 0;
      return syncCommand(run, output);
    }
    if (*repair) {
      RunRequest request;
      request.dataclasses = {repaired};
      request.repair = true;
      return syncCommand(request, output);
    }
    if (*conflicts)
      return conflictsCommand(*restoreConflict ? "restore"
                              : *dropConflict  ? "drop"
                                               : "",
                              conflictId, output);
    if (*status) return statusCommand(statusJson, output);
    if (*passphrase) return passphraseCommand(output);
    if (*encrypt)
      return encryptCommand(encryptPassphraseCommand.empty()
                                ? std::nullopt
                                : std::optional<std::string>(encryptPassphraseCommand),
                            output);
    if (*config)
      return configCommand(*configGet   ? "get"
                           : *configSet ? "set"
                                        : "",
                           setting, settingValue, output);
    if (*forget) return forgetCommand(forgotten, forceForget, output);
    if (*schedule)
      return scheduleCommand(scheduleSwitch == "on",
                             every.empty() ? std::nullopt : std::optional<std::string>(every),
                             output);
    if (*pushing) return pushCommand(pushSwitch == "on", output);
    if (*listen) return listenCommand(output);
    if (launchSync) {
      RunRequest launched;
      launched.dataclasses = launchDataclasses;
      launched.periodic = periodic;
      return syncCommand(launched, output);
    }
    std::cout << app.help();
    return static_cast<int>(FailureKind::Usage);
  } catch (const SyncFailure& e) {
    std::cerr << "nubilosyncclient: " << shownSafely(e.what()) << "\n";
    return e.exitStatus();
  } catch (const NubiloException& e) {
    std::cerr << "nubilosyncclient: " << shownSafely(failureSentence("the account", e)) << "\n";
    return static_cast<int>(failureKind(e));
  } catch (const std::bad_alloc&) {
    std::cerr << "nubilosyncclient: this computer could not give the command the memory it "
                 "needed; nothing more was done.\n";
    return static_cast<int>(FailureKind::Other);
  } catch (const std::exception& e) {
    std::cerr << "nubilosyncclient: " << shownSafely(e.what()) << "\n";
    return static_cast<int>(FailureKind::Other);
  }
}

}  // namespace vtc::client
