// Writing and reading a changelog of 10,000 changes of ten properties each,
// beside zlib alone deflating and inflating the same uncompressed body.
//
// Two sets of records (the benchmark argument):
//   0 uniform:  "propertyN" set to "value N", N or N/2: nearly all repetition,
//               which zlib inflates at over 1 GB/s;
//   1 contacts: names, e-mail addresses, phone numbers, streets, dates and a
//               line of notes, drawn from fixed word lists with a fixed seed.
#include <benchmark/benchmark.h>
#include <zlib.h>

#include <cstdlib>
#include <memory>
#include <random>

#include "VantorSyncManager/NubiloChangeLog.h"
#include "VantorSyncManager/NubiloDataAdditions.h"

namespace {

constexpr int kChanges = 10000;

vtc::Value propertyChange(std::string name, vtc::Value value) {
  return vtc::Value(
      vtc::Dictionary{{"action", "set"}, {"name", std::move(name)}, {"value", std::move(value)}});
}

std::vector<SyncEngineChange> uniformChanges() {
  std::vector<SyncEngineChange> changes;
  for (int i = 0; i < kChanges; ++i) {
    vtc::Array props;
    for (int p = 0; p < 10; ++p) {
      vtc::Value value = p % 3 == 0   ? vtc::Value("value " + std::to_string(i * 10 + p))
                         : p % 3 == 1 ? vtc::Value(i * 10 + p)
                                      : vtc::Value(i * 0.5 + p);
      props.push_back(propertyChange("property" + std::to_string(p), value));
    }
    changes.emplace_back(1 + i % 3, "record-" + std::to_string(i), std::move(props));
  }
  return changes;
}

std::vector<SyncEngineChange> contactChanges() {
  static const char* kFirst[] = {"Ada",   "Bruno", "Chiara", "Dmitri", "Elif",  "Farah", "Goran",
                                 "Hana",  "Ivo",   "Jonas",  "Keiko",  "Lucía", "Mateo", "Nadia",
                                 "Oskar", "Priya", "Quinn",  "Rania",  "Sven",  "Tomás"};
  static const char* kLast[] = {"Abbott",   "Berg",      "Castillo", "Dvořák",  "Eriksen",
                                "Fischer",  "Gallo",     "Haddad",   "Ivanova", "Jensen",
                                "Kowalski", "Lindqvist", "Moreau",   "Novak",   "Okafor",
                                "Petrov",   "Quint",     "Rossi",    "Sato",    "Tanaka"};
  static const char* kWords[] = {
      "meeting",    "garden", "invoice",  "birthday", "holiday", "project", "school", "dentist",
      "call",       "back",   "after",    "lunch",    "the",     "new",     "office", "address",
      "prefers",    "email",  "mornings", "allergic", "to",      "peanuts", "met",    "at",
      "conference", "in",     "spring",   "ask",      "about",   "kids",    "dog",    "moved"};
  static const char* kStreets[] = {"Linden Way",     "Harbour Road",  "Mill Lane",
                                   "Station Street", "Orchard Close", "Kingsgate",
                                   "Rue des Lilas",  "Via Roma"};
  std::mt19937 random(20261122);
  auto pick = [&](const auto& list) { return list[random() % std::size(list)]; };
  std::vector<SyncEngineChange> changes;
  for (int i = 0; i < kChanges; ++i) {
    std::string first = pick(kFirst), last = pick(kLast);
    std::string notes;
    for (unsigned w = 0, n = 4 + random() % 12; w < n; ++w) {
      if (w > 0) notes += ' ';
      notes += pick(kWords);
    }
    std::string phone = "+";
    phone += std::to_string(10000000000LL + random() % 900000000);
    vtc::Array props{
        propertyChange("first name", first),
        propertyChange("last name", last),
        propertyChange("email", first + '.' + std::to_string(random() % 1000) + "@mail.example"),
        propertyChange("phone", phone),
        propertyChange("street", std::to_string(1 + random() % 200) + " " + pick(kStreets)),
        propertyChange("postal code", std::to_string(10000 + random() % 90000)),
        propertyChange("birthday", vtc::Date(std::chrono::seconds(
                                       -631152000 + static_cast<int64_t>(random() % 1500000000)))),
        propertyChange("notes", notes),
        propertyChange("modification count", static_cast<int>(random() % 50)),
        propertyChange("rating", (random() % 1000) / 100.0),
    };
    changes.emplace_back(1 + i % 3, "contact-" + std::to_string(random()), std::move(props));
  }
  return changes;
}

struct Fixture {
  explicit Fixture(std::vector<SyncEngineChange> made) : changes(std::move(made)) {
    NubiloChangeLog log(changes);
    log.writeToData(file);
    body = *NubiloCopyGunzip(vtc::ByteView(file).subspan(NubiloUInt32AtOffset(file, 8)));
    compressedBody = *NubiloGzip(body);
  }
  std::vector<SyncEngineChange> changes;
  vtc::Bytes file, body, compressedBody;
};

Fixture& fixture(benchmark::State& state) {
  ::setenv("HOME", "/tmp/vsm-bench-home", 1);
  static Fixture uniform(uniformChanges());
  static Fixture contacts(contactChanges());
  Fixture& f = state.range(0) == 0 ? uniform : contacts;
  state.SetLabel((state.range(0) == 0 ? "uniform, body " : "contacts, body ") +
                 std::to_string(f.body.size() / 1024) + " KiB, compressed " +
                 std::to_string(f.compressedBody.size() / 1024) + " KiB");
  return f;
}

void report(benchmark::State& state, size_t bytes) {
  state.counters["changes/s"] =
      benchmark::Counter(double{kChanges} * state.iterations(), benchmark::Counter::kIsRate);
  state.SetBytesProcessed(static_cast<int64_t>(bytes) * state.iterations());
}

void WriteChangelog(benchmark::State& state) {
  auto& f = fixture(state);
  NubiloChangeLog log(f.changes);
  for (auto _ : state) {
    vtc::Bytes out;
    log.writeToData(out);
    benchmark::DoNotOptimize(out.data());
  }
  report(state, f.body.size());
}

// From bytes to changes; freeing them is timed apart, in the next benchmark.
void ReadChangelog(benchmark::State& state) {
  auto& f = fixture(state);
  for (auto _ : state) {
    auto log = std::make_unique<NubiloChangeLog>(f.file);
    benchmark::DoNotOptimize(log->changes().data());
    state.PauseTiming();
    log.reset();
    state.ResumeTiming();
  }
  report(state, f.body.size());
}

void ReadAndFreeChangelog(benchmark::State& state) {
  auto& f = fixture(state);
  for (auto _ : state) {
    NubiloChangeLog log(f.file);
    benchmark::DoNotOptimize(log.changes().data());
  }
  report(state, f.body.size());
}

void ZlibDeflateBody(benchmark::State& state) {
  auto& f = fixture(state);
  for (auto _ : state) {
    auto out = NubiloGzip(f.body);  // the same raw deflate stream the writer makes
    benchmark::DoNotOptimize(out->data());
  }
  report(state, f.body.size());
}

void ZlibInflateBody(benchmark::State& state) {
  auto& f = fixture(state);
  for (auto _ : state) {
    auto out = NubiloCopyGunzip(f.compressedBody);
    benchmark::DoNotOptimize(out->data());
  }
  report(state, f.body.size());
}

}  // namespace

BENCHMARK(WriteChangelog)->Arg(0)->Arg(1)->Unit(benchmark::kMillisecond);
BENCHMARK(ZlibDeflateBody)->Arg(0)->Arg(1)->Unit(benchmark::kMillisecond);
BENCHMARK(ReadChangelog)->Arg(0)->Arg(1)->Unit(benchmark::kMillisecond);
BENCHMARK(ReadAndFreeChangelog)->Arg(0)->Arg(1)->Unit(benchmark::kMillisecond);
BENCHMARK(ZlibInflateBody)->Arg(0)->Arg(1)->Unit(benchmark::kMillisecond);
