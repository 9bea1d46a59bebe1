// `sync [NAME...]` and the launch form `--sync`: one line per dataclass,
// and a plain sentence on standard error for each failure.
#include <ostream>

#include "client/cli/Commands.h"

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
  if (o.invalidFiles)
    line += ", " + counted(o.invalidFiles, "invalid file", "invalid files") + " skipped";
  if (o.compacted) line += ", history compacted";
  return line;
}

}  // namespace

int syncCommand(const RunRequest& request, Output& output) {
  RunResult result = runSync(request);
  for (const DataclassOutcome& outcome : result.outcomes) {
    bool failed = false;
    for (const DataclassFailure& f : result.failures)
      failed = failed || f.dataclass == outcome.dataclass;
    if (!failed && output.verbosity > 0) output.out << describe(outcome, request.dryRun) << "\n";
  }
  for (const DataclassFailure& failure : result.failures)
    output.err << "nubilosyncclient: " << failure.sentence << "\n";
  return result.exitStatus();
}

}  // namespace vtc::client
