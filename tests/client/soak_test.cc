// Three computers syncing in loops for thirty seconds while random edits land
// in their folders: at the end they hold the same data, and every edit is
// present, overridden, undone by a delete or kept as a conflict.
#include <gtest/gtest.h>
#include <unistd.h>

#include <cstdio>

#include "localshare/Soak.h"
#include "platform/fs/LocalPaths.h"
#include "support/TestHome.h"

namespace {

namespace paths = vtc::paths;

TEST(Soak, ThreeComputersEditingAndSyncingAtOnceLoseAndDuplicateNothing) {
  vtc::test::TestHome home;
  vtc::local::SoakOptions options;
  options.seconds = 30;
  options.evidenceFolder =
      paths::join(paths::temporaryDirectory(), "vsm-soak-evidence-" + std::to_string(::getpid()));
  options.progress = [](const std::string& line) {
    std::printf("soak: %s\n", line.c_str());
    std::fflush(stdout);
  };
  const vtc::local::SoakReport r = vtc::local::runSoak(options);
  std::printf(
      "soak: %lld syncs (%lld failed and retried), %lld adds, %lld edits, %lld deletes, "
      "%lld renames, %lld lock waits, %lld conflicts kept, %lld syncs naming the record set "
      "aside, %lld computers with it set aside at the end, %lld cards and %lld events at the end\n",
      static_cast<long long>(r.syncs), static_cast<long long>(r.failedSyncs),
      static_cast<long long>(r.adds), static_cast<long long>(r.edits),
      static_cast<long long>(r.deletes), static_cast<long long>(r.renames),
      static_cast<long long>(r.lockWaits), static_cast<long long>(r.conflicts),
      static_cast<long long>(r.leftOverSyncs), static_cast<long long>(r.setAside),
      static_cast<long long>(r.cardsAtEnd), static_cast<long long>(r.eventsAtEnd));
  for (const std::string& problem : r.problems) ADD_FAILURE() << problem;
  EXPECT_GT(r.edits, 0);
  EXPECT_GT(r.leftOverSyncs, 0) << "no sync set the faulty record aside";
}

}  // namespace
