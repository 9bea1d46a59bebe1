// The sync engine: pushing 10,000 changes and pulling them again, over a
// store of 10,000 and of 100,000 records. The pull should cost what the
// changes cost, whatever the size of the store.
#include <benchmark/benchmark.h>

#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <map>

#include "platform/engine/SyncEngine.h"

namespace {

using vtc::engine::SyncEngine;

std::vector<SyncEngineChange> batch(const std::string& prefix, int count) {
  std::vector<SyncEngineChange> changes;
  changes.reserve(count);
  for (int i = 0; i < count; ++i) {
    vtc::Array props;
    for (int p = 0; p < 5; ++p)
      props.push_back(vtc::Value(vtc::Dictionary{{"action", "set"},
                                                 {"name", "field" + std::to_string(p)},
                                                 {"value", "value " + std::to_string(i + p)}}));
    changes.emplace_back(1, prefix + std::to_string(i), std::move(props));
  }
  return changes;
}

// A store of `records` records that the network client has already pulled.
SyncEngine& store(int records) {
  static std::map<int, std::unique_ptr<SyncEngine>> stores;
  auto& engine = stores[records];
  if (!engine) {
    ::setenv("HOME", "/tmp/vsm-engine-bench", 1);
    std::string path = "/tmp/vsm-engine-bench-" + std::to_string(records) + ".sqlite";
    std::filesystem::remove(path);
    std::filesystem::remove(path + "-wal");
    engine = SyncEngine::open(path);
    for (int at = 0; at < records; at += 10000)
      engine->push("seed", "Contacts", batch("seed" + std::to_string(at) + "-", 10000));
    auto r = engine->pull("net", "Contacts");
    engine->acknowledge("net", "Contacts", r.anchor);
  }
  return *engine;
}

void PushThenPull(benchmark::State& state) {
  SyncEngine& engine = store(static_cast<int>(state.range(0)));
  double pushSeconds = 0, pullSeconds = 0;
  int round = 0;
  for (auto _ : state) {
    auto changes = batch("round" + std::to_string(round++) + "-", 10000);
    auto start = std::chrono::steady_clock::now();
    engine.push("app.a", "Contacts", changes);
    auto pushed = std::chrono::steady_clock::now();
    auto pulled = engine.pull("net", "Contacts");
    auto done = std::chrono::steady_clock::now();
    engine.acknowledge("net", "Contacts", pulled.anchor);
    if (pulled.changes.size() != 10000) state.SkipWithError("lost changes");
    pushSeconds += std::chrono::duration<double>(pushed - start).count();
    pullSeconds += std::chrono::duration<double>(done - pushed).count();
    state.SetIterationTime(std::chrono::duration<double>(done - start).count());
  }
  state.counters["push_ms"] = 1000 * pushSeconds / static_cast<double>(state.iterations());
  state.counters["pull_ms"] = 1000 * pullSeconds / static_cast<double>(state.iterations());
}

}  // namespace

BENCHMARK(PushThenPull)
    ->Arg(10000)
    ->Arg(100000)
    ->Iterations(3)
    ->UseManualTime()
    ->Unit(benchmark::kMillisecond);
