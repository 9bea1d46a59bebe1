// Fetching 200 changelogs of 10 changes each from a real share: the
// session's batched fetch (download and parse) against curl fetching the
// same files over one keep-alive connection, in the same run. The fetch also
// reports how many TCP connections it used, read from the access log.
// Build with -DVSM_BENCH=ON (the tests must be on too: the share comes from
// their fixtures).
#include <benchmark/benchmark.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <memory>
#include <set>

#include "VantorSyncManager/NubiloRemoteSession.h"
#include "localshare/ApacheShare.h"
#include "platform/dav/DavPaths.h"
#include "platform/dav/TesselSession.h"
#include "platform/fs/LocalPaths.h"

namespace {

constexpr const char* kDataclass = "com.korvo.Contacts";
constexpr int kChangeLogs = 200;

struct Fixture {
  std::string home;
  std::unique_ptr<vtc::local::ApacheShare> share;
  std::unique_ptr<NubiloRemoteSession> session;
  std::string curlConfig;  // one url= line per changelog

  Fixture() {
    std::string dir =
        vtc::paths::join(vtc::paths::temporaryDirectory(), "vsm-transfer-bench-XXXXXX");
    home = ::mkdtemp(dir.data());
    ::setenv("HOME", home.c_str(), 1);
    share = std::make_unique<vtc::local::ApacheShare>();
    session = open();
    session->getDataclassInfo(kDataclass);
    for (int index = 1; index <= kChangeLogs; ++index) {
      std::vector<SyncEngineChange> changes;
      for (int c = 0; c < 10; ++c)
        changes.emplace_back(
            SyncEngineChange::kModify, "record-" + std::to_string(index * 10 + c),
            vtc::Array{vtc::Value(vtc::Dictionary{
                {"action", "set"}, {"name", "EMAIL"}, {"value", "someone@example.org"}})});
      session->commitChanges(changes, kDataclass, index, index == 1);
    }
    std::ofstream config(home + "/curl.conf");
    for (int index = 1; index <= kChangeLogs; ++index)
      config << "url = \"http://127.0.0.1:" << share->port()
             << vtc::davpath::escape(session->changeLogPathForDataclass(kDataclass, index))
             << "\"\noutput = /dev/null\n";
    curlConfig = home + "/curl.conf";
  }
  ~Fixture() {
    session.reset();
    share.reset();
    std::filesystem::remove_all(home);
  }
  std::unique_ptr<NubiloRemoteSession> open() const {
    vtc::Dictionary config = share->configuration();
    return NubiloRemoteSession::sessionWithUsername(vtc::local::ApacheShare::kUser,
                                                    vtc::local::ApacheShare::kPassword, config);
  }
};

Fixture& fixture() {
  static Fixture f;
  return f;
}

void SessionFetch(benchmark::State& state) {
  Fixture& f = fixture();
  auto session = f.open();
  size_t connections = 0;
  for (auto _ : state) {
    const size_t before = f.share->accessEntries().size();
    auto result = session->fetchChangeLogsForDataclass(kDataclass, 1, kChangeLogs);
    benchmark::DoNotOptimize(result);
    state.PauseTiming();
    if (result.changeLogs.size() != kChangeLogs) state.SkipWithError("changelogs missing");
    std::set<int> ports;
    const auto entries = f.share->accessEntries();
    for (size_t i = before; i < entries.size(); ++i) ports.insert(entries[i].clientPort);
    connections = ports.size();
    state.ResumeTiming();
  }
  state.counters["tcp_connections"] = static_cast<double>(connections);
}

void CurlGets(benchmark::State& state) {
  Fixture& f = fixture();
  const std::string command = "curl -sf --basic -u " + std::string(vtc::local::ApacheShare::kUser) +
                              ":" + vtc::local::ApacheShare::kPassword + " -K " + f.curlConfig;
  for (auto _ : state)
    if (std::system(command.c_str()) != 0) state.SkipWithError("curl failed");
}

// The same GETs through the WebDAV layer alone, without retry or parsing.
void PlainSessionGets(benchmark::State& state) {
  Fixture& f = fixture();
  auto session = f.open();
  for (auto _ : state)
    for (int index = 1; index <= kChangeLogs; ++index)
      benchmark::DoNotOptimize(session->tesselSession().getDataAtPath(
          session->changeLogPathForDataclass(kDataclass, index)));
}

BENCHMARK(SessionFetch)->Unit(benchmark::kMillisecond)->UseRealTime()->MinTime(2);
BENCHMARK(PlainSessionGets)->Unit(benchmark::kMillisecond)->UseRealTime()->MinTime(2);
BENCHMARK(CurlGets)->Unit(benchmark::kMillisecond)->UseRealTime()->MinTime(2);

}  // namespace
