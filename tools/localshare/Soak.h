// A soak of the sync: several computers on one share, each syncing in a
// loop while random edits land in its address book and calendar (adds,
// edits of single and repeated properties, of a series and of one of its
// occurrences, exceptions added, renames and deletes), with the locks
// really contended; a faulty fourth computer puts a record no computer can
// write on the share on the way. At the end every computer syncs until
// quiet, and the outcome is held against a model of every edit: each one
// is present, overridden by a later edit of the same field, undone by a
// delete, or kept as a conflict; no item is lost and none is there twice,
// and the faulty record is set aside everywhere without stopping anything.
#pragma once

#include <cstdint>
#include <functional>
#include <string>
#include <vector>

namespace vtc::local {

struct SoakOptions {
  int computers = 3;
  double seconds = 30;
  int startingCards = 100;  // made on the first computer before the loops
  unsigned seed = 1;
  // When set and the soak finds a problem, every computer's home and the
  // share's folder are copied here, for a person to read what happened.
  std::string evidenceFolder;
  // Told how far the soak has come: each phase as it ends, and every run of
  // the client that took more than ten seconds.
  std::function<void(const std::string&)> progress;
};

struct SoakReport {
  int64_t syncs = 0;        // runs of the client
  int64_t failedSyncs = 0;  // runs that ended with a failure (and were run again)
  int64_t adds = 0, edits = 0, deletes = 0, renames = 0;
  int64_t leftOverSyncs = 0;  // runs that synced but named an item set aside (exit 9)
  int64_t lockWaits = 0;  // lock attempts refused because another computer held it
  int64_t conflicts = 0;  // losing values kept, over all computers
  int64_t cardsAtEnd = 0, eventsAtEnd = 0;
  int64_t setAside = 0;  // records set aside at the end, over all computers
  std::vector<std::string> problems;  // anything lost, duplicated, or different
};

SoakReport runSoak(const SoakOptions& options);

}  // namespace vtc::local
