// Time and peak memory of refusing a small hostile changelog: one record
// whose archive is an array holding itself REFS times (default a million).
// The body is nearly all repetition, so the file stays a few kilobytes.
//   self_reference_measure write FILE [REFS]   writes the changelog
//   self_reference_measure read FILE           reads it, prints what it cost
#include <sys/resource.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <iterator>

#include "VantorSyncManager/NubiloChangeLog.h"
#include "VantorSyncManager/NubiloDataAdditions.h"
#include "VantorSyncManager/NubiloException.h"

namespace {

// bplist00 | array of refs references to object 0 (itself) | table | trailer
vtc::Bytes selfReferencingArchive(uint32_t refs) {
  vtc::Bytes doc = {'b', 'p', 'l', 'i', 's', 't', '0', '0', 0xAF, 0x12};
  NubiloAppendUInt32(doc, refs);
  doc.insert(doc.end(), refs, 0);
  const size_t tableAt = doc.size();
  doc.push_back(8);  // object 0 starts right after the magic
  vtc::Bytes trailer(32, 0);
  trailer[6] = 1;   // offset width
  trailer[7] = 1;   // reference width
  trailer[15] = 1;  // one object, the top one
  for (int i = 0; i < 8; ++i) trailer[31 - i] = static_cast<uint8_t>(tableAt >> (8 * i));
  doc.insert(doc.end(), trailer.begin(), trailer.end());
  return doc;
}

vtc::Bytes changelogWithOneRecord(const vtc::Bytes& archive) {
  vtc::Bytes body;
  NubiloAppendString(body, "loop");
  NubiloAppendUInt32(body, 1);
  NubiloAppendUInt32(body, static_cast<uint32_t>(archive.size()));
  body.insert(body.end(), archive.begin(), archive.end());
  vtc::Bytes file;
  NubiloAppendUInt32(file, 101);
  NubiloAppendUInt32(file, 16);  // one record
  NubiloAppendUInt32(file, 0);   // the body start, filled in below
  NubiloAppendUInt32(file, 0xFFFFFFFF);
  NubiloAppendString(file, "HeaderEnd=$%__END__OF__HEADER%$");
  const auto bodyStart = static_cast<uint32_t>(file.size());
  for (int i = 0; i < 4; ++i) file[8 + i] = static_cast<uint8_t>(bodyStart >> (24 - 8 * i));
  vtc::Bytes zipped = *NubiloGzip(body);
  file.insert(file.end(), zipped.begin(), zipped.end());
  return file;
}

long peakKiB() {
  rusage usage{};
  getrusage(RUSAGE_SELF, &usage);
  return usage.ru_maxrss;
}

}  // namespace

int main(int argc, char** argv) {
  ::setenv("HOME", "/tmp/vsm-measure-home", 1);
  if ((argc == 3 || argc == 4) && std::strcmp(argv[1], "write") == 0) {
    const auto refs = static_cast<uint32_t>(argc == 4 ? std::atol(argv[3]) : 1000000);
    vtc::Bytes file = changelogWithOneRecord(selfReferencingArchive(refs));
    std::ofstream(argv[2], std::ios::binary)
        .write(reinterpret_cast<const char*>(file.data()),
               static_cast<std::streamsize>(file.size()));
    std::printf("wrote %zu bytes, an archive of %u self-references\n", file.size(), refs);
    return 0;
  }
  if (argc == 3 && std::strcmp(argv[1], "read") == 0) {
    std::ifstream in(argv[2], std::ios::binary);
    vtc::Bytes file((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
    const long before = peakKiB();
    const auto start = std::chrono::steady_clock::now();
    const char* outcome = "read";
    try {
      NubiloChangeLog log(file);
    } catch (const NubiloException& e) {
      outcome = "refused";
    }
    const double ms =
        std::chrono::duration<double, std::milli>(std::chrono::steady_clock::now() - start).count();
    std::printf("%s %zu bytes in %.1f ms, peak memory %+ld KiB\n", outcome, file.size(), ms,
                peakKiB() - before);
    return 0;
  }
  std::fprintf(stderr, "usage: %s write FILE [REFS] | read FILE\n", argv[0]);
  return 2;
}
