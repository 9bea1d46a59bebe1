// Feeds arbitrary bytes to the changelog reader: it may refuse them as
// corrupt, but must never crash, hang or read out of bounds.
#include <cstdlib>
#include <string>

#include "VantorSyncManager/NubiloChangeLog.h"
#include "VantorSyncManager/NubiloException.h"

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  // Crash flags and the log go to a private home.
  static std::string home = "/tmp/vsm-fuzz-home";
  ::setenv("HOME", home.c_str(), 1);
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  try {
    NubiloChangeLog log(vtc::ByteView(data, size));
    log.summary();
  } catch (const NubiloException&) {
    // Refused as corrupt: the expected answer to most inputs.
  }
  return 0;
}
