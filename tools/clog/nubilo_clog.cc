// nubilo-clog: looks inside changelog files.
//   nubilo-clog dump FILE     the text dump, with its summary line; for an
//                             encrypted account's changelog, its envelope
//                             and the size of the encrypted body
//   nubilo-clog verify FILE   exit 0 for a readable changelog, 1 and the reason otherwise
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <exception>
#include <fstream>
#include <iterator>
#include <memory>

#include "VantorSyncManager/VantorSyncManager.h"
#include "changelog/ChangeLogEnvelope.h"

int main(int argc, char** argv) {
  if (argc != 3 || (std::strcmp(argv[1], "dump") != 0 && std::strcmp(argv[1], "verify") != 0)) {
    std::fprintf(stderr, "usage: nubilo-clog dump FILE\n       nubilo-clog verify FILE\n");
    return 2;
  }
  // The library reads an unreadable file as an empty changelog; here it is
  // worth saying so.
  if (std::FILE* f = std::fopen(argv[2], "rb")) {
    std::fclose(f);
  } else {
    std::fprintf(stderr, "%s: %s\n", argv[2], std::strerror(errno));
    return 1;
  }
  try {
    std::ifstream in(argv[2], std::ios::binary);
    const vtc::Bytes bytes{std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>()};
    auto log = std::make_unique<NubiloChangeLog>(bytes);
    if (std::strcmp(argv[1], "dump") == 0) {
      std::fflush(stdout);
      log->dumpToTextFile("/dev/stdout", true);
    } else {
      std::printf("%s: readable changelog, format %u, %zu changes\n", argv[2], log->version(),
                  log->changes().size());
    }
    if (auto envelope = vtc::clog::readEnvelope(bytes))
      std::printf("Body: %zu bytes, encrypted (%s); only the account's key opens it\n",
                  envelope->body.size(),
                  envelope->headers.get(vtc::clog::kBodyEncryptionHeader).string().c_str());
    // Records read past are told, not silently left out.
    for (const vtc::RefusedChange& r : log->refusedChanges())
      std::printf("record %zu (%s) passed over: %s\n", r.position, r.recordIdentifier.c_str(),
                  r.reason.c_str());
    return 0;
  } catch (const NubiloException& e) {
    std::fprintf(stderr, "%s: %s\n", argv[2], e.reason().c_str());
  } catch (const std::exception& e) {
    std::fprintf(stderr, "%s: %s\n", argv[2], e.what());
  }
  return 1;
}
