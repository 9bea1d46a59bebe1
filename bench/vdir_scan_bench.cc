// Scanning a vdir folder of 1,000 and 10,000 contacts: once with nothing
// known (every file read and split), and again with every file known and
// unchanged, which should cost one stat per file and the known states
// handed over.
#include <benchmark/benchmark.h>

#include <filesystem>
#include <fstream>
#include <map>

#include "client/stores/VdirCollection.h"

namespace {

using vtc::client::ItemKind;
using vtc::client::ItemState;
using vtc::client::VdirCollection;

// A folder of `items` contacts, made once per size.
const VdirCollection& folder(int items) {
  static std::map<int, VdirCollection> folders;
  auto found = folders.find(items);
  if (found != folders.end()) return found->second;
  std::string path = "/tmp/vsm-vdir-bench-" + std::to_string(items);
  std::filesystem::remove_all(path);
  std::filesystem::create_directories(path);
  for (int i = 0; i < items; ++i) {
    std::string n = std::to_string(i);
    std::ofstream(path + "/person" + n + ".vcf", std::ios::binary)
        << "BEGIN:VCARD\r\nVERSION:3.0\r\nUID:person" << n << "\r\nFN:Person " << n << "\r\nN:" << n
        << ";Person;;;\r\nEMAIL;TYPE=home:person" << n << "@mail.example\r\nTEL;TYPE=cell:+1 555 "
        << n << "\r\nADR;TYPE=home:;;" << n << " Main Street;Springfield;;12345;\r\n"
        << "NOTE:Met at the conference in spring\\, talked about gardens.\r\nEND:VCARD\r\n";
  }
  return folders.emplace(items, VdirCollection(path, ItemKind::Contacts)).first->second;
}

void BM_ScanNothingKnown(benchmark::State& state) {
  const VdirCollection& store = folder(static_cast<int>(state.range(0)));
  for (auto _ : state) benchmark::DoNotOptimize(store.scan({}));
}
BENCHMARK(BM_ScanNothingKnown)->Arg(1000)->Arg(10000)->Unit(benchmark::kMillisecond);

// Known states passed as a copy (the caller keeps its own) and moved in.
void BM_ScanAllUnchanged(benchmark::State& state) {
  const VdirCollection& store = folder(static_cast<int>(state.range(0)));
  std::map<std::string, ItemState> known = store.scan({}).states;
  bool move = state.range(1) != 0;
  size_t read = 0;
  for (auto _ : state) {
    if (move) {
      state.PauseTiming();
      std::map<std::string, ItemState> copy = known;
      state.ResumeTiming();
      read += store.scan(std::move(copy)).filesRead;
    } else {
      read += store.scan(known).filesRead;
    }
  }
  if (read != 0) state.SkipWithError("an unchanged file was read");
}
BENCHMARK(BM_ScanAllUnchanged)
    ->ArgsProduct({{1000, 10000}, {0, 1}})
    ->ArgNames({"items", "moved"})
    ->Unit(benchmark::kMillisecond);

}  // namespace
