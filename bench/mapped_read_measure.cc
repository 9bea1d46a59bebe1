// Peak memory of reading a large changelog through the mapped class.
//   mapped_read_measure write FILE MB   writes a changelog of about MB megabytes
//   mapped_read_measure read FILE       decodes it and prints the decoded size
// Run "read" under /usr/bin/time -v and compare its maximum resident size
// with the decoded size printed.
#include <sys/resource.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <random>

#include "VantorSyncManager/NubiloChangeLog.h"

namespace {

// Bytes held by the decoded changes, counted from their contents.
size_t decodedSize(const std::vector<SyncEngineChange>& changes) {
  size_t total = changes.capacity() * sizeof(SyncEngineChange);
  for (const auto& c : changes) {
    total += c.recordIdentifier().capacity();
    for (const auto& p : c.changes()) {
      total += sizeof(vtc::Value) + 256;  // the dictionary and its three entries
      total += p.dictionary().get("value").data().capacity();
    }
  }
  return total;
}

}  // namespace

int main(int argc, char** argv) {
  ::setenv("HOME", "/tmp/vsm-measure-home", 1);
  if (argc == 4 && std::strcmp(argv[1], "write") == 0) {
    const size_t records = static_cast<size_t>(std::atol(argv[3])) * 1024;  // ~1 KiB each
    std::mt19937 random(7);
    std::vector<SyncEngineChange> changes;
    changes.reserve(records);
    for (size_t i = 0; i < records; ++i) {
      vtc::Bytes blob(1000);
      for (auto& b : blob) b = static_cast<uint8_t>(random());  // incompressible
      changes.emplace_back(
          1, "record-" + std::to_string(i),
          vtc::Array{vtc::Value(vtc::Dictionary{
              {"action", "set"}, {"name", "blob"}, {"value", vtc::Value(std::move(blob))}})});
    }
    NubiloChangeLog log(std::move(changes));
    vtc::Bytes out;
    log.writeToData(out);
    std::ofstream(argv[2], std::ios::binary)
        .write(reinterpret_cast<const char*>(out.data()), static_cast<std::streamsize>(out.size()));
    std::printf("wrote %zu bytes\n", out.size());
    return 0;
  }
  if (argc == 3 && std::strcmp(argv[1], "read") == 0) {
    std::string copy = std::string(argv[2]) + ".reading";
    std::ifstream in(argv[2], std::ios::binary);
    std::ofstream(copy, std::ios::binary) << in.rdbuf();  // the changelog deletes what it maps
    auto log = NubiloMappedChangelog::adoptingFile(copy);
    const auto& changes = log->changes();
    rusage usage{};
    getrusage(RUSAGE_SELF, &usage);
    long pages = 0, resident = 0;
    if (std::FILE* f = std::fopen("/proc/self/statm", "r")) {
      if (std::fscanf(f, "%ld %ld", &pages, &resident) != 2) resident = 0;
      std::fclose(f);
    }
    const long residentMB = resident * (sysconf(_SC_PAGESIZE) / 1024) / 1024;
    std::printf(
        "decoded %zu changes (about %zu MB of records); resident now %ld MB (the records and the "
        "program), peak %ld MB: %ld MB above\n",
        changes.size(), decodedSize(changes) >> 20, residentMB, usage.ru_maxrss >> 10,
        (usage.ru_maxrss >> 10) - residentMB);
    return 0;
  }
  std::fprintf(stderr, "usage: mapped_read_measure write FILE MB | read FILE\n");
  return 2;
}
