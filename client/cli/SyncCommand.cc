// `sync [NAME...]` and the launch form `--sync`. On a terminal: a progress
// line while it works, then a line per dataclass; elsewhere one line for the
// whole run. Every failure is a plain sentence on standard error.
#include <memory>
#include <ostream>

#include "client/cli/Commands.h"
#include "client/cli/ProgressLine.h"
#include "client/cli/TerminalText.h"

namespace vtc::client {

namespace {

std::string counted(size_t n, const char* one, const char* many) {
  return std::to_string(n) + " " + (n == 1 ? one : many);
}

std::string describe(const DataclassOutcome& o, bool dryRun) {
  std::string line = o.dataclass + (dryRun ? " (dry run): " : ": ");
  if (!o.usedServer && o.filesWritten == 0) return line + "up to date";
  if (dryRun)
    line += "would send " + counted(o.sentChanges, "change", "changes") + ", receive " +
            counted(o.receivedChanges, "change", "changes") + " and write " +
            counted(o.filesWritten, "file", "files");
  else
    line += "sent " + counted(o.sentChanges, "change", "changes") + ", received " +
            counted(o.receivedChanges, "change", "changes") + ", wrote " +
            counted(o.filesWritten, "file", "files");
  if (o.mode == "slow") line += " (slow sync)";
  if (o.conflicts) line += ", kept " + counted(o.conflicts, "conflict", "conflicts");
  if (o.filesSkipped)
    line += ", " + counted(o.filesSkipped, "file", "files") + " changed meanwhile (next sync)";
  if (!o.invalidFiles.empty())
    line += ", " + counted(o.invalidFiles.size(), "invalid file", "invalid files") + " skipped";
  if (!o.setAside.empty())
    line += ", " + counted(o.setAside.size(), "item", "items") + " set aside";
  if (o.deletesUndone)
    line += ", " + counted(o.deletesUndone, "delete", "deletes") + " undone by edits elsewhere";
  if (o.confirmedDeletes)
    line +=
        ", " + counted(o.confirmedDeletes, "delete", "deletes") + " confirmed on another computer";
  if (o.compacted) line += ", history compacted";
  return line;
}

// Off a terminal (a job, a push) one line says it all.
std::string summary(const RunResult& result, bool dryRun) {
  size_t sent = 0, received = 0, written = 0, conflicts = 0, skipped = 0, compacted = 0;
  for (const DataclassOutcome& o : result.outcomes) {
    compacted += o.compacted;
    sent += o.sentChanges;
    received += o.receivedChanges;
    written += o.filesWritten;
    conflicts += o.conflicts;
    skipped += o.filesSkipped;
  }
  std::string line = (dryRun ? "Dry run of " : "Synced ") +
                     counted(result.outcomes.size() - result.failures.size(), "folder", "folders");
  line += (dryRun ? ": would send " : ": sent ") + counted(sent, "change", "changes") +
          ", received " + counted(received, "change", "changes") + ", wrote " +
          counted(written, "file", "files");
  if (conflicts) line += ", kept " + counted(conflicts, "conflict", "conflicts");
  if (skipped) line += ", " + counted(skipped, "file", "files") + " left for the next sync";
  if (compacted) line += ", history compacted";
  if (!result.failures.empty())
    line += "; " + counted(result.failures.size(), "failure", "failures");
  return line + ".";
}

}  // namespace

int syncCommand(RunRequest request, Output& output) {
  std::unique_ptr<ProgressLine> progress;
  if (output.terminal && output.verbosity > 0) {
    progress = std::make_unique<ProgressLine>(stderr);
    request.progress = progress.get();
  }
  RunResult result = runSync(request);
  progress.reset();
  for (const std::string& warning : result.warnings)
    output.err << "nubilosyncclient: warning: " << warning << "\n";
  const bool perDataclass = output.verbosity > 1 || (output.terminal && output.verbosity > 0);
  for (const DataclassOutcome& outcome : result.outcomes) {
    bool failed = false;
    for (const DataclassFailure& f : result.failures)
      failed = failed || f.dataclass == outcome.dataclass;
    if (!failed && perDataclass) output.out << describe(outcome, request.dryRun) << "\n";
  }
  if (!perDataclass && output.verbosity > 0) output.out << summary(result, request.dryRun) << "\n";
  // What was left over is named every time, until the user has seen to it.
  for (const DataclassOutcome& o : result.outcomes) {
    for (const auto& [file, why] : o.invalidFiles)
      output.err << "nubilosyncclient: " << o.dataclass << ": skipped " << file << ": " << why
                 << "\n";
    for (const SetAsideItem& item : o.setAside)
      output.err << "nubilosyncclient: " << o.dataclass << ": set aside " << item.file
                 << (item.origin.empty() ? "" : " (from " + item.origin + ")") << ": "
                 << item.reason << "\n";
    for (const std::string& failure : o.writeFailures)
      output.err << "nubilosyncclient: " << o.dataclass << ": could not write " << failure << "\n";
  }
  for (const DataclassFailure& failure : result.failures)
    output.err << "nubilosyncclient: " << shownSafely(failure.sentence) << "\n";
  return result.exitStatus();
}

}  // namespace vtc::client
