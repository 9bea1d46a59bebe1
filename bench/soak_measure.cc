// The soak at length: soak_measure [SECONDS] [COMPUTERS] [SEED]. Prints the
// counts and every problem found (the target: none).
#include <cstdio>
#include <cstdlib>

#include "localshare/Soak.h"
#include "platform/fs/LocalPaths.h"

int main(int argc, char** argv) {
  vtc::local::SoakOptions options;
  if (argc > 1) options.seconds = std::atof(argv[1]);
  if (argc > 2) options.computers = std::atoi(argv[2]);
  if (argc > 3) options.seed = static_cast<unsigned>(std::atoi(argv[3]));
  std::string home = vtc::paths::join(vtc::paths::temporaryDirectory(), "vsm-soak-XXXXXX");
  ::setenv("HOME", ::mkdtemp(home.data()), 1);
  const vtc::local::SoakReport r = vtc::local::runSoak(options);
  std::printf(
      "%.0f s, %d computers: %lld syncs (%lld failed and retried), %lld adds, %lld edits, "
      "%lld deletes, %lld renames, %lld lock waits, %lld conflicts kept, %lld syncs naming "
      "the record set aside, %lld computers with it set aside at the end, %lld cards and %lld "
      "events at the end, %zu problems\n",
      options.seconds, options.computers, static_cast<long long>(r.syncs),
      static_cast<long long>(r.failedSyncs), static_cast<long long>(r.adds),
      static_cast<long long>(r.edits), static_cast<long long>(r.deletes),
      static_cast<long long>(r.renames), static_cast<long long>(r.lockWaits),
      static_cast<long long>(r.conflicts), static_cast<long long>(r.leftOverSyncs),
      static_cast<long long>(r.setAside), static_cast<long long>(r.cardsAtEnd),
      static_cast<long long>(r.eventsAtEnd), r.problems.size());
  for (const std::string& p : r.problems) std::printf("  %s\n", p.c_str());
  return r.problems.empty() ? 0 : 1;
}
