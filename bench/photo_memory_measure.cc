// Memory and transfer of an address book whose cards carry photos: the
// first sync of the computer that holds it and of one that receives it, then
// one-field edits synced one by one and the other computer catching up.
//
//   photo_memory_measure [CARDS] [PHOTO_BYTES] [EDITS]   (default 5000 24576 65)
#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <random>
#include <string>
#include <vector>

#include "localshare/Computer.h"
#include "localshare/Share.h"
#include "platform/fs/LocalPaths.h"

using vtc::local::Computer;
using vtc::local::Share;

namespace {

// Base64 of random bytes (as incompressible as a JPEG), folded at 75 octets.
std::string photo(std::mt19937& random, size_t bytes) {
  static const char kAlphabet[] =
      "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
  std::string text = "PHOTO;ENCODING=b;TYPE=JPEG:";
  const size_t chars = (bytes + 2) / 3 * 4;
  size_t column = text.size();
  for (size_t i = 0; i < chars; ++i) {
    if (column == 75) {
      text += "\r\n ";
      column = 1;
    }
    text += kAlphabet[random() & 63];
    ++column;
  }
  return text + "\r\n";
}

std::string card(int i, int edit, const std::string& picture) {
  const std::string n = std::to_string(i);
  return "BEGIN:VCARD\r\nVERSION:3.0\r\nUID:photo-" + n + "@example.org\r\nFN:Person " + n +
         "\r\nN:Person;" + n + ";;;\r\nEMAIL:person." + n + "@example.org\r\nTEL:+1 555 " +
         std::to_string(edit) + "\r\n" + picture + "END:VCARD\r\n";
}

uint64_t bytesUnder(const std::string& folder) {
  uint64_t total = 0;
  for (const auto& entry : std::filesystem::recursive_directory_iterator(folder))
    if (entry.is_regular_file()) total += entry.file_size();
  return total;
}

// Bytes of the files the share served to GETs since entry `from`.
uint64_t downloaded(const Share& share, size_t from) {
  const auto entries = share.accessEntries();
  uint64_t total = 0;
  for (size_t i = from; i < entries.size(); ++i) {
    if (entries[i].method != "GET" || entries[i].status != 200) continue;
    std::error_code error;
    const auto size = std::filesystem::file_size(share.diskPath(entries[i].path), error);
    if (!error) total += size;
  }
  return total;
}

void report(const char* what, const Computer::Result& r) {
  std::printf("%-34s %8.2f s %9.1f MB peak   %s\n", what, r.seconds, r.peakKilobytes / 1024.0,
              r.status == 0 ? "" : ("failed: " + r.err).c_str());
}

}  // namespace

int main(int argc, char** argv) {
  const int cards = argc > 1 ? std::atoi(argv[1]) : 5000;
  const size_t photoBytes = argc > 2 ? std::strtoul(argv[2], nullptr, 10) : 24576;
  const int edits = argc > 3 ? std::atoi(argv[3]) : 65;
  std::string tmpl = vtc::paths::join(vtc::paths::temporaryDirectory(), "vsm-photo-XXXXXX");
  const std::string home = ::mkdtemp(tmpl.data());
  ::setenv("HOME", home.c_str(), 1);
  auto server = vtc::local::startShare(vtc::local::ShareKind::Apache);
  Share& share = *server;
  Computer a("Mac A"), b("Mac B");
  a.join(share.url("/sync"), Share::kUser, Share::kPassword);
  b.join(share.url("/sync"), Share::kUser, Share::kPassword);
  // A profiler for the syncs only (VSM_SYNC_WRAPPER="valgrind --tool=massif").
  if (const char* wrapper = std::getenv("VSM_SYNC_WRAPPER"))
    ::setenv("VSM_CLIENT_WRAPPER", wrapper, 1);

  std::mt19937 random(7);
  std::vector<std::string> pictures;
  for (int i = 0; i < cards; ++i) {
    pictures.push_back(photo(random, photoBytes));
    Computer::write(a.contacts() + "/photo-" + std::to_string(i) + ".vcf",
                    card(i, 0, pictures.back()));
  }
  const uint64_t data = bytesUnder(a.contacts());
  std::printf("%d cards with %zu-byte photos: %.1f MB of vCards\n", cards, photoBytes, data / 1e6);

  report("A's first sync", a.runMeasured({"sync"}));
  const size_t beforeB = share.accessEntries().size();
  report("B's first sync", b.runMeasured({"sync"}));
  std::printf("%-34s %8.1f MB\n", "B downloaded", downloaded(share, beforeB) / 1e6);
  uint64_t mostOnShare = bytesUnder(share.documentRoot());

  auto start = std::chrono::steady_clock::now();
  long mostEditPeak = 0;
  for (int e = 0; e < edits; ++e) {
    const int i = e % cards;
    Computer::write(a.contacts() + "/photo-" + std::to_string(i) + ".vcf",
                    card(i, e + 1, pictures[i]));
    Computer::Result r = a.runMeasured({"sync"});
    if (r.status != 0) std::fprintf(stderr, "edit %d: %s\n", e, r.err.c_str());
    mostEditPeak = std::max(mostEditPeak, r.peakKilobytes);
    mostOnShare = std::max(mostOnShare, bytesUnder(share.documentRoot()));
  }
  std::printf("%-34s %8.2f s %9.1f MB peak\n",
              (std::to_string(edits) + " one-field edits on A").c_str(),
              std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count(),
              mostEditPeak / 1024.0);
  const size_t beforeCatchUp = share.accessEntries().size();
  Computer::Result catchUp = b.runMeasured({"sync", "-v"});
  report("B catches up", catchUp);
  std::printf(
      "%-34s %8.1f MB %s\n", "B downloaded", downloaded(share, beforeCatchUp) / 1e6,
      catchUp.out.find("slow sync") != std::string::npos ? "(slow sync)" : "(no slow sync)");
  std::printf("%-34s %8.1f MB (%.2f x the data)\n", "most bytes on the share", mostOnShare / 1e6,
              static_cast<double>(mostOnShare) / static_cast<double>(data));
  if (Computer::files(a.contacts()) != Computer::files(b.contacts()))
    std::fprintf(stderr, "the two folders differ!\n");
  std::filesystem::remove_all(home);
  return 0;
}
