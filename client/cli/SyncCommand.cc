// `sync [NAME...]` and the launch form `--sync`. On a terminal: a progress
// line while it works, then a line per dataclass; elsewhere one line for the
// whole run. Every failure is a plain sentence on standard error.
#include <algorithm>
#include <memory>
#include <ostream>
#include <vector>

#include "client/cli/Commands.h"
#include "client/cli/ProgressLine.h"
#include "client/cli/TerminalText.h"

namespace vtc::client {

namespace {

std::string counted(size_t n, const char* one, const char* many) {
  return std::to_string(n) + " " + (n == 1 ? one : many);
}

// Files written (added or changed) and removed here, of what filesWritten
// counts.
std::pair<size_t, size_t> writtenAndDeleted(const DataclassOutcome& o) {
  size_t deleted = 0;
  for (const ItemActivity& item : o.items) deleted += item.here == ItemActivity::Change::Delete;
  deleted = std::min(deleted, o.filesWritten);
  return {o.filesWritten - deleted, deleted};
}

// "wrote 2 files", "deleted 1 file", "wrote 2 files and deleted 1 file".
std::string filesDone(size_t written, size_t deleted, bool dryRun) {
  std::string text;
  if (written || !deleted)
    text = (dryRun ? "write " : "wrote ") + counted(written, "file", "files");
  if (deleted)
    text += (text.empty() ? "" : " and ") + std::string(dryRun ? "delete " : "deleted ") +
            counted(deleted, "file", "files");
  return text;
}

std::string describe(const DataclassOutcome& o, bool dryRun) {
  std::string line = o.dataclass + (dryRun ? " (dry run): " : ": ");
  if (!o.usedServer && o.filesWritten == 0) return line + "up to date";
  const auto [written, deleted] = writtenAndDeleted(o);
  if (dryRun)
    line += "would send " + counted(o.sentChanges, "change", "changes") + ", receive " +
            counted(o.receivedChanges, "change", "changes") + " and " +
            filesDone(written, deleted, true);
  else
    line += "sent " + counted(o.sentChanges, "change", "changes") + ", received " +
            counted(o.receivedChanges, "change", "changes") + ", " +
            filesDone(written, deleted, false);
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

// One line per item a sync sent or wrote, by the item's name: "  Ann Smith
// (ann.vcf): sent (changed); deleted here".
void listItems(const DataclassOutcome& o, bool dryRun, std::ostream& out) {
  using Change = ItemActivity::Change;
  auto word = [](Change c) {
    return c == Change::Add ? "new" : c == Change::Edit ? "changed" : "deleted";
  };
  auto here = [](Change c) {
    return c == Change::Add ? "added here" : c == Change::Edit ? "changed here" : "deleted here";
  };
  for (const ItemActivity& item : o.items) {
    if (item.sent == Change::None && item.here == Change::None) continue;
    std::string line = "  " + shownSafely(item.name.empty() ? item.file : item.name);
    if (!item.file.empty() && item.name != item.file) line += " (" + shownSafely(item.file) + ")";
    line += ": ";
    std::vector<std::string> parts;
    if (item.sent != Change::None)
      parts.push_back(std::string(dryRun ? "would be sent (" : "sent (") + word(item.sent) + ")");
    if (item.here != Change::None)
      parts.push_back(std::string(dryRun ? "would be " : "") + here(item.here));
    for (size_t i = 0; i < parts.size(); ++i) line += (i ? "; " : "") + parts[i];
    out << line << "\n";
  }
}

// Off a terminal (a job, a push) one line says it all.
std::string summary(const RunResult& result, bool dryRun) {
  size_t sent = 0, received = 0, written = 0, deleted = 0, conflicts = 0, skipped = 0,
         compacted = 0;
  for (const DataclassOutcome& o : result.outcomes) {
    compacted += o.compacted;
    sent += o.sentChanges;
    received += o.receivedChanges;
    const auto [w, d] = writtenAndDeleted(o);
    written += w;
    deleted += d;
    conflicts += o.conflicts;
    skipped += o.filesSkipped;
  }
  std::string line = (dryRun ? "Dry run of " : "Synced ") +
                     counted(result.outcomes.size() - result.failures.size(), "folder", "folders");
  if (dryRun)
    line += ": would send " + counted(sent, "change", "changes") + ", receive " +
            counted(received, "change", "changes") + " and " + filesDone(written, deleted, true);
  else
    line += ": sent " + counted(sent, "change", "changes") + ", received " +
            counted(received, "change", "changes") + ", " + filesDone(written, deleted, false);
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
    // A dry run names what it would do; -v names what a sync did.
    if (perDataclass && (request.dryRun || output.verbosity > 1))
      listItems(outcome, request.dryRun, output.out);
  }
  if (!perDataclass && output.verbosity > 0) {
    output.out << summary(result, request.dryRun) << "\n";
    if (request.dryRun)
      for (const DataclassOutcome& outcome : result.outcomes) listItems(outcome, true, output.out);
  }
  // What was left over is named every time, until the user has seen to it.
  for (const DataclassOutcome& o : result.outcomes) {
    for (const std::string& note : o.notes)
      output.err << "nubilosyncclient: " << shownSafely(note) << "\n";
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
