// A fault at every request of a whole sync (session setup, the listing,
// locks, the record, the fetch, the commit, the status and the report):
// each request in turn fails once, in each way. The sync ends with plain
// sentences and the exit status of its kind (or rides the fault out), and
// the next sync converges with nothing lost and nothing twice.
#include <gmock/gmock.h>

#include "localshare/ApacheShare.h"
#include "localshare/Computer.h"
#include "support/FaultProxy.h"
#include "support/TestHome.h"

using testing::HasSubstr;
using vtc::local::ApacheShare;
using vtc::local::Computer;

namespace {

std::string card(int i, int version) {
  return "BEGIN:VCARD\r\nVERSION:3.0\r\nUID:p" + std::to_string(i) + "\r\nFN:Person " +
         std::to_string(i) + "\r\nNOTE:version " + std::to_string(version) + "\r\nEND:VCARD\r\n";
}

class FaultAtEveryRequest : public ::testing::TestWithParam<std::string> {
 protected:
  vtc::test::TestHome home;
  ApacheShare share;
  vtc::test::FaultProxy proxy{share.port()};
  Computer a{"Mac A"};  // straight to the share
  Computer b{"Mac B"};  // through the proxy, waiting a second for an answer
  std::map<std::string, std::string> expected;
  int round = 0;

  void SetUp() override {
    a.join("http://127.0.0.1:" + std::to_string(share.port()) + "/sync", ApacheShare::kUser,
           ApacheShare::kPassword);
    b.join("http://127.0.0.1:" + std::to_string(proxy.port()) + "/sync", ApacheShare::kUser,
           ApacheShare::kPassword);
    b.setPreference("sync_dav_timeout_seconds", vtc::Value(1));
    for (int i = 0; i < 4; ++i) edit(a, i);
    sync(a);
    sync(b);
  }
  void edit(const Computer& c, int i) {
    const std::string name = "p" + std::to_string(i) + ".vcf";
    expected[name] = card(i, ++round);
    Computer::write(c.contacts() + "/" + name, expected[name]);
  }
  void sync(const Computer& c) {
    Computer::Result r = c.run({"sync"});
    ASSERT_EQ(r.status, 0) << c.name() << ": " << r.err;
  }
  // Something for B to fetch and something for it to send.
  void prepare() {
    edit(a, 0);
    sync(a);
    edit(b, 1 + round % 3);
  }
  void fail(int nth) {
    const std::string& fault = GetParam();
    vtc::test::Match match{"", "", nth};
    if (fault == "time-out")
      proxy.timeOut(match);
    else if (fault == "dropped")
      proxy.dropConnection(match);
    else
      proxy.answer(match, std::stoi(fault));
  }
};

TEST_P(FaultAtEveryRequest, EndsPlainlyAndTheNextSyncConverges) {
  prepare();
  proxy.clear();
  const size_t before = proxy.requests().size();
  sync(b);
  const int requests = static_cast<int>(proxy.requests().size() - before);
  ASSERT_GE(requests, 15);  // setup, listing, locks, record, fetch, commit, unlocks, report
  std::set<int> statuses;
  for (int nth = 1; nth <= requests; ++nth) {
    SCOPED_TRACE("request " + std::to_string(nth) + " fails: " + GetParam());
    prepare();
    proxy.clear();
    fail(nth);
    Computer::Result faulted = b.run({"sync"});
    proxy.clear();
    statuses.insert(faulted.status);
    EXPECT_THAT(faulted.status, testing::AnyOf(0, 1, 4)) << faulted.err;
    std::istringstream lines(faulted.err);
    for (std::string line; std::getline(lines, line);) {
      EXPECT_THAT(line, testing::StartsWith("nubilosyncclient: "));
      EXPECT_THAT(line, testing::EndsWith("."));
      EXPECT_THAT(line, testing::Not(HasSubstr("DavTransaction")));
    }
    EXPECT_EQ(faulted.status != 0, !faulted.err.empty()) << faulted.err;

    sync(b);
    sync(a);
    ASSERT_EQ(Computer::files(a.contacts()), expected);
    ASSERT_EQ(Computer::files(b.contacts()), expected);
  }
  std::printf("%s: %d requests, each failed once; exit statuses seen:", GetParam().c_str(),
              requests);
  for (int s : statuses) std::printf(" %d", s);
  std::printf("\n");
}

INSTANTIATE_TEST_SUITE_P(Faults, FaultAtEveryRequest,
                         testing::Values("time-out", "dropped", "500", "507", "423"),
                         [](const auto& info) {
                           std::string name = info.param;
                           name.erase(std::remove(name.begin(), name.end(), '-'), name.end());
                           return "Fault" + name;
                         });

}  // namespace
