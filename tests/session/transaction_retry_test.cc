// Requests with retry against a real share: the not-found pauses, the
// non-overwriting move, a server that goes away, entity tags, and the
// records of a trace report.
#include <gtest/gtest.h>

#include "VantorSyncManager/NubiloException.h"
#include "VantorSyncManager/NubiloRemoteSession.h"
#include "VantorSyncManager/PublicNames.h"
#include "platform/dav/TesselSession.h"
#include "support/ApacheShare.h"
#include "support/FakeTime.h"
#include "support/ShareTest.h"
#include "support/TestHome.h"
#include "support/TraceCapture.h"

using vtc::test::ApacheShare;
using vtc::test::TraceCapture;

namespace {

constexpr const char* kRetry = "com.korvo.sync.nubilosession.retrytransaction";
constexpr const char* kCode = "com.korvo.sync.nubilosession.retrytransaction.errorcode";
constexpr const char* kFinal = "com.korvo.sync.nubilosession.retrytransaction.final";

class Retry : public vtc::test::ShareTest {
 protected:
  std::unique_ptr<NubiloRemoteSession> session;

  void SetUp() override { session = openSession(); }
  std::string schemas() const { return session->schemasPath(); }
};

TEST_F(Retry, AMissingDownloadIsTriedOnceMoreAfterAPause) {
  DavTransaction t = session->getDataWithRetryAtPath(schemas() + "/00001.clog");
  EXPECT_EQ(t.httpStatusCode(), 404);
  EXPECT_EQ(time.sleeps(), std::vector<double>{30});
  ASSERT_EQ(traces.withDomain(kRetry).size(), 2u);
  EXPECT_EQ(TraceCapture::field(traces.withDomain(kRetry)[1], "COM_KORVO_MESSAGE_VALUE"), "1");
  ASSERT_EQ(traces.withDomain(kFinal).size(), 1u);
  EXPECT_EQ(TraceCapture::field(traces.withDomain(kFinal)[0], "MESSAGE"), "Failed to get data");

  session->getDataWithRetryAtPath(schemas() + "/00002.clog", std::nullopt, 0, 0, std::nullopt);
  EXPECT_EQ(time.sleeps(), (std::vector<double>{30, 2}));

  // Other failures are returned at once and not reported.
  session->putDataWithRetry({'x'}, schemas() + "/no/such/folder/file");
  session->_issuePropFindWithRetryAtPath(schemas() + "/missing/", kDAVZeroDepth, {});
  EXPECT_EQ(time.sleeps().size(), 2u);
  EXPECT_EQ(traces.withDomain(kRetry).size(), 4u);
}

TEST_F(Retry, ANonOverwritingMoveOntoAnExistingTargetIsReturnedNotRaised) {
  session->putDataWithRetry({'1'}, schemas() + "/a.clog");
  session->putDataWithRetry({'2'}, schemas() + "/b.clog");
  DavTransaction t =
      session->moveResourceWithRetryAtPath(schemas() + "/a.clog", schemas() + "/b.clog", false);
  EXPECT_FALSE(t.isSuccessful());
  EXPECT_EQ(t.httpStatusCode(), 412);
  EXPECT_TRUE(traces.records().empty());
  EXPECT_TRUE(session->moveResourceWithRetryAtPath(schemas() + "/a.clog", schemas() + "/b.clog")
                  .isSuccessful());
}

TEST_F(Retry, AServerThatWentAwayRaisesANetworkFailure) {
  share.stop();
  try {
    session->putDataWithRetry({'x'}, schemas() + "/00001.clog");
    FAIL() << "no exception";
  } catch (const NubiloException& e) {
    EXPECT_EQ(e.name(), NubiloNetworkFailureException);
    EXPECT_EQ(e.reason().rfind("putData transaction failed due to network error, ", 0), 0u)
        << e.reason();
  }
  ASSERT_EQ(traces.withDomain(kFinal).size(), 1u);
  EXPECT_EQ(TraceCapture::field(traces.withDomain(kFinal)[0], "COM_KORVO_MESSAGE_SIGNATURE"),
            "Raised Exception");
  EXPECT_EQ(TraceCapture::field(traces.withDomain(kCode)[0], "COM_KORVO_MESSAGE_SIGNATURE"),
            "kNBNetworkError");
  EXPECT_TRUE(time.sleeps().empty());
}

TEST_F(Retry, EntityTagsCompareWithoutTheWeakPrefix) {
  TesselSession& dav = session->tesselSession();
  dav.makeCollectionAtPath(schemas() + "/Contacts", false);
  DavTransaction t = dav._issuePropFindAtPath(schemas() + "/Contacts/", 0, {"DAV:getetag"});
  std::string tag =
      t.result().dictionary().begin()->second.dictionary().get("DAV:getetag").string();
  ASSERT_FALSE(tag.empty());
  std::string bare = tag.starts_with("W/") ? tag.substr(2) : tag;
  EXPECT_FALSE(session->eTagChangedForDataclass("Contacts", bare));
  EXPECT_FALSE(session->eTagChangedForDataclass("Contacts", "W/" + bare));
  EXPECT_TRUE(session->eTagChangedForDataclass("Contacts", "\"something-else\""));
  EXPECT_TRUE(session->eTagChangedForDataclass("Unknown", "eTagNotFound"));  // find failed
}

TEST(TraceReport, RecordsOfARetriedAFinalAndAnUnnamedResult) {
  vtc::test::TestHome home;
  TraceCapture traces;
  ApacheShare share;
  vtc::Dictionary config = share.configuration();
  auto session = NubiloRemoteSession::sessionWithUsername("alice", "wonderland", config);

  DavTransaction timedOut("PROPFIND", "/x");
  timedOut.setOutcome(false, kNBTimeoutError, vtc::kNoHTTPStatus, vtc::kTransactionNoAnswer);
  session->messageTraceTransactionFailure(timedOut, false, 0, "Failed to get properties");
  auto records = traces.records();
  ASSERT_EQ(records.size(), 2u);
  EXPECT_EQ(TraceCapture::field(records[0], "COM_KORVO_MESSAGE_SIGNATURE"), "PROPFIND");
  EXPECT_EQ(TraceCapture::field(records[0], "COM_KORVO_MESSAGE_RESULT"), "noop");
  EXPECT_EQ(TraceCapture::field(records[0], "COM_KORVO_MESSAGE_EVENT"), session->eventUUID());
  EXPECT_EQ(TraceCapture::field(records[1], "COM_KORVO_MESSAGE_SIGNATURE"), "kNBTimeoutError");
  EXPECT_EQ(TraceCapture::field(records[1], "COM_KORVO_MESSAGE_SIGNATURE2"), "");  // no status
  EXPECT_EQ(TraceCapture::field(records[0], "COM_KORVO_MESSAGE_UUID"),
            TraceCapture::field(records[1], "COM_KORVO_MESSAGE_UUID"));

  DavTransaction odd("PUT", "/y");
  odd.setOutcome(false, 42, 500, vtc::kTransactionCompleted);
  session->messageTraceTransactionFailure(odd, true, 1, "Failed to put data");
  records = traces.records();
  ASSERT_EQ(records.size(), 5u);
  EXPECT_EQ(TraceCapture::field(records[3], "COM_KORVO_MESSAGE_SIGNATURE"), "42");
  EXPECT_EQ(TraceCapture::field(records[3], "COM_KORVO_MESSAGE_SIGNATURE2"), "500");
  EXPECT_EQ(TraceCapture::field(records[4], "COM_KORVO_MESSAGE_RESULT"), "failure");
  EXPECT_NE(TraceCapture::field(records[2], "COM_KORVO_MESSAGE_UUID"),
            TraceCapture::field(records[0], "COM_KORVO_MESSAGE_UUID"));

  session->messageTraceTransactionFailure(DavTransaction(), true, 0, "no request, no records");
  EXPECT_EQ(traces.records().size(), 5u);
}

}  // namespace
