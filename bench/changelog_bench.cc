// Writing and reading a changelog of 10,000 changes of ten properties each,
// beside zlib alone deflating and inflating the same uncompressed body.
#include <benchmark/benchmark.h>
#include <zlib.h>

#include <cstdlib>

#include "VantorSyncManager/NubiloChangeLog.h"
#include "VantorSyncManager/NubiloDataAdditions.h"

namespace {

std::vector<SyncEngineChange> makeChanges() {
  std::vector<SyncEngineChange> changes;
  for (int i = 0; i < 10000; ++i) {
    vtc::Array props;
    for (int p = 0; p < 10; ++p) {
      vtc::Value value = p % 3 == 0   ? vtc::Value("value " + std::to_string(i * 10 + p))
                         : p % 3 == 1 ? vtc::Value(i * 10 + p)
                                      : vtc::Value(i * 0.5 + p);
      props.push_back(vtc::Value(vtc::Dictionary{
          {"action", "set"}, {"name", "property" + std::to_string(p)}, {"value", value}}));
    }
    changes.emplace_back(1 + i % 3, "record-" + std::to_string(i), std::move(props));
  }
  return changes;
}

struct Fixture {
  Fixture() {
    ::setenv("HOME", "/tmp/vsm-bench-home", 1);
    changes = makeChanges();
    NubiloChangeLog log(changes);
    log.writeToData(file);
    body = *NubiloCopyGunzip(vtc::ByteView(file).subspan(NubiloUInt32AtOffset(file, 8)));
    compressedBody = *NubiloGzip(body);
  }
  std::vector<SyncEngineChange> changes;
  vtc::Bytes file, body, compressedBody;
};

Fixture& fixture() {
  static Fixture f;
  return f;
}

void report(benchmark::State& state, size_t bytes) {
  state.counters["changes/s"] =
      benchmark::Counter(10000.0 * state.iterations(), benchmark::Counter::kIsRate);
  state.SetBytesProcessed(static_cast<int64_t>(bytes) * state.iterations());
}

void WriteChangelog(benchmark::State& state) {
  auto& f = fixture();
  NubiloChangeLog log(f.changes);
  for (auto _ : state) {
    vtc::Bytes out;
    log.writeToData(out);
    benchmark::DoNotOptimize(out.data());
  }
  report(state, f.body.size());
}

void ReadChangelog(benchmark::State& state) {
  auto& f = fixture();
  for (auto _ : state) {
    NubiloChangeLog log(f.file);
    benchmark::DoNotOptimize(log.changes().data());
  }
  report(state, f.body.size());
}

void ZlibDeflateBody(benchmark::State& state) {
  auto& f = fixture();
  for (auto _ : state) {
    auto out = NubiloGzip(f.body);  // the same raw deflate stream the writer makes
    benchmark::DoNotOptimize(out->data());
  }
  report(state, f.body.size());
}

void ZlibInflateBody(benchmark::State& state) {
  auto& f = fixture();
  for (auto _ : state) {
    auto out = NubiloCopyGunzip(f.compressedBody);
    benchmark::DoNotOptimize(out->data());
  }
  report(state, f.body.size());
}

}  // namespace

BENCHMARK(WriteChangelog)->Unit(benchmark::kMillisecond);
BENCHMARK(ReadChangelog)->Unit(benchmark::kMillisecond);
BENCHMARK(ZlibDeflateBody)->Unit(benchmark::kMillisecond);
BENCHMARK(ZlibInflateBody)->Unit(benchmark::kMillisecond);
