// The sync client in the shape users meet it: two computers and a local
// share, an address book of vCards of about 470 bytes, each phase timed as a
// whole command and its requests counted in the server's access log. The
// floor in the same run: curl fetching as many such files over one
// keep-alive connection. The phases run for an account in the clear and an
// encrypted one, in turns, and each phase's best of three rounds is shown,
// the encrypted one also as a multiple of the plain one.
//
//   client_sync_measure [CARDS] [apache|sabre]     (default 1000, apache)
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <set>
#include <string>
#include <vector>

#include "localshare/Computer.h"
#include "localshare/Corpus.h"
#include "localshare/Share.h"
#include "platform/fs/LocalPaths.h"

using vtc::local::Computer;
using vtc::local::Share;

namespace {

struct Phase {
  const char* name;
  double seconds = 0;
  double cpu = 0;  // the client's own user and system time
  size_t requests = 0;
  size_t writes = 0;
};

Phase timed(const char* name, Share& share, const Computer& c) {
  const size_t before = share.accessEntries().size();
  auto start = std::chrono::steady_clock::now();
  Computer::Result r = c.run({"sync"});
  Phase p{name};
  p.seconds = std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
  p.cpu = r.cpuSeconds;
  if (r.status != 0) std::fprintf(stderr, "%s failed: %s\n", name, r.err.c_str());
  const auto entries = share.accessEntries();
  p.requests = entries.size() - before;
  for (size_t i = before; i < entries.size(); ++i)
    if (entries[i].method != "PROPFIND" && entries[i].method != "GET") ++p.writes;
  return p;
}

// Phases (a) to (e) of two new computers of an account at syncPath, plain
// or encrypted; bytes: the cards' total size.
std::vector<Phase> measure(Share& share, int cards, const std::string& syncPath, bool encrypted,
                           size_t& bytes) {
  const std::string url = share.url(syncPath);
  Computer a("Mac A"), b("Mac B");
  std::vector<std::string> moreA, moreB;
  if (encrypted) {
    moreA = a.passphraseArguments("correct horse battery staple");
    moreA.push_back("--encrypt");
    moreB = b.passphraseArguments("correct horse battery staple");
  }
  moreA.push_back("--new");  // beside the other rounds' areas
  a.join(url, Share::kUser, Share::kPassword, moreA);
  b.join(url, Share::kUser, Share::kPassword, moreB);
  bytes = 0;
  for (int i = 0; i < cards; ++i) {
    std::string c = vtc::local::peerCard(i, 0);
    bytes += c.size();
    Computer::write(a.contacts() + "/person-" + std::to_string(i) + ".vcf", c);
  }

  std::vector<Phase> phases;
  phases.push_back(timed("(a) A's first sync", share, a));
  phases.push_back(timed("(b) B's first sync", share, b));
  for (int i = 0; i < cards && i < 100; ++i)
    Computer::write(a.contacts() + "/person-" + std::to_string(i) + ".vcf",
                    vtc::local::peerCard(i, 1));
  phases.push_back(timed("(c) A sends 100 edits", share, a));
  phases.push_back(timed("(d) B receives them", share, b));
  // Nothing changed can be repeated: the best of five.
  Phase idle = timed("(e) nothing changed", share, b);
  for (int run = 1; run < 5; ++run) {
    Phase again = timed("(e) nothing changed", share, b);
    if (again.seconds < idle.seconds) idle = again;
  }
  phases.push_back(idle);
  if (Computer::files(a.contacts()) != Computer::files(b.contacts()))
    std::fprintf(stderr, "the two folders differ!\n");
  return phases;
}

}  // namespace

constexpr int kRounds = 3;

int main(int argc, char** argv) {
  const int cards = argc > 1 ? std::atoi(argv[1]) : 1000;
  std::string tmpl =
      vtc::paths::join(vtc::paths::temporaryDirectory(), "vsm-client-measure-XXXXXX");
  const std::string home = ::mkdtemp(tmpl.data());
  ::setenv("HOME", home.c_str(), 1);
  const bool sabre = argc > 2 && std::string(argv[2]) == "sabre";
  auto server =
      vtc::local::startShare(sabre ? vtc::local::ShareKind::Sabre : vtc::local::ShareKind::Apache);
  Share& share = *server;
  // Accounts in the clear and encrypted, on the same server in the same
  // run, taken in turns (the machine's load comes and goes); each phase's
  // best of the rounds.
  size_t bytes = 0;
  std::vector<Phase> phases, sealed;
  auto best = [](std::vector<Phase>& kept, const std::vector<Phase>& round) {
    if (kept.empty()) kept = round;
    for (size_t i = 0; i < round.size(); ++i)
      if (round[i].seconds < kept[i].seconds) kept[i] = round[i];
  };
  for (int round = 0; round < kRounds; ++round) {
    const std::string n = std::to_string(round);
    best(phases, measure(share, cards, "/sync" + n, false, bytes));
    best(sealed, measure(share, cards, "/sealed" + n, true, bytes));
  }

  // The floor: the same files fetched by curl over one connection.
  const std::string floorPath = share.diskPath("/floor");
  std::filesystem::create_directories(floorPath);
  std::ofstream config(home + "/curl.conf");
  for (int i = 0; i < cards; ++i) {
    Computer::write(floorPath + "/" + std::to_string(i) + ".vcf", vtc::local::peerCard(i, 1));
    config << "url = \"http://127.0.0.1:" << share.port() << "/floor/" << i
           << ".vcf\"\noutput = /dev/null\n";
  }
  config.close();
  std::filesystem::permissions(floorPath, std::filesystem::perms::all,
                               std::filesystem::perm_options::add);
  for (auto& f : std::filesystem::directory_iterator(floorPath))
    std::filesystem::permissions(f.path(), std::filesystem::perms::all,
                                 std::filesystem::perm_options::add);
  const std::string curl = "curl -sf -u " + std::string(Share::kUser) + ":" + Share::kPassword +
                           " -K " + home + "/curl.conf";
  double floor = 1e9;
  for (int run = 0; run < 3; ++run) {
    auto start = std::chrono::steady_clock::now();
    if (std::system(curl.c_str()) != 0) std::fprintf(stderr, "curl failed\n");
    floor = std::min(
        floor, std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count());
  }

  std::printf("%s: %d cards, %zu bytes on average\n", share.name(), cards,
              bytes / static_cast<size_t>(cards));
  std::printf("%-24s %10s %8s %9s %7s %9s\n", "phase", "seconds", "cpu", "requests", "writes",
              "x floor");
  for (const Phase& p : phases)
    std::printf("%-24s %10.3f %8.3f %9zu %7zu %9.2f\n", p.name, p.seconds, p.cpu, p.requests,
                p.writes, p.seconds / floor);
  std::printf("%-24s %10.3f %9d\n", "floor: curl GETs", floor, cards);
  std::printf("\nencrypted account\n%-24s %10s %8s %9s %7s %9s\n", "phase", "seconds", "cpu",
              "requests", "writes", "x plain");
  for (size_t i = 0; i < sealed.size(); ++i)
    std::printf("%-24s %10.3f %8.3f %9zu %7zu %9.2f\n", sealed[i].name, sealed[i].seconds,
                sealed[i].cpu, sealed[i].requests, sealed[i].writes,
                sealed[i].seconds / phases[i].seconds);
  std::filesystem::remove_all(home);
  return 0;
}
