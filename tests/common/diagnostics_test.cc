// Message traces (as records handed to the journal, caught at the capture
// seam), the statistics file, and the internal-network test.
#include <gtest/gtest.h>

#include "VantorSyncManager/Diagnostics.h"
#include "platform/network/InterfaceAddresses.h"
#include "platform/plist/PlistCodec.h"
#include "support/TestHome.h"
#include "support/TraceCapture.h"

using vtc::test::TraceCapture;

namespace {

TEST(MessageTrace, NullFieldsAreSkippedAndANullDomainOrAFailedSendGoesToStandardError) {
  TraceCapture capture;
  VTCMessageTrace("com.korvo.test", "sig", nullptr, nullptr, nullptr, "U-1", "1", nullptr, "hello",
                  "event");
  auto records = capture.records();
  ASSERT_EQ(records.size(), 1u);
  std::vector<std::string> fields;
  for (const auto& [k, v] : records[0]) fields.push_back(k);
  EXPECT_EQ(fields,
            (std::vector<std::string>{"COM_KORVO_MESSAGE_DOMAIN", "COM_KORVO_MESSAGE_SIGNATURE",
                                      "COM_KORVO_MESSAGE_UUID", "COM_KORVO_MESSAGE_VALUE",
                                      "COM_KORVO_MESSAGE_EVENT", "PRIORITY", "MESSAGE"}));
  EXPECT_EQ(TraceCapture::field(records[0], "PRIORITY"), "6");
  EXPECT_EQ(TraceCapture::field(records[0], "MESSAGE"), "hello");

  testing::internal::CaptureStderr();
  VTCMessageTrace(nullptr, "sig", nullptr, nullptr, "noop", nullptr, nullptr, nullptr, "m",
                  nullptr);
  std::string err = testing::internal::GetCapturedStderr();
  EXPECT_EQ(capture.records().size(), 1u);  // nothing more
  EXPECT_EQ(err.rfind("asl_log() or its precursors failed: ", 0), 0u) << err;

  vtc::installMessageTraceSink([](const vtc::MessageTraceRecord&) { return -5; });
  testing::internal::CaptureStderr();
  VTCMessageTrace("d", "s", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "m", nullptr);
  EXPECT_EQ(testing::internal::GetCapturedStderr(), "asl_log() or its precursors failed: -5\n");
  vtc::installMessageTraceSink({});
}

TEST(Statistics, MergesIntoTheFileAndStartsItWhenMissing) {
  vtc::test::TestHome home;
  std::string path = home.path() + "/Library/Logs/Sync/nubilosyncstats.plist";
  ASSERT_TRUE(VTCLogStatistics(vtc::Dictionary{}));
  EXPECT_EQ(*vtc::plist::readFile(path), vtc::Value(vtc::Dictionary{}));
  ASSERT_TRUE(VTCLogStatistics(vtc::Dictionary{{"syncs", 1}, {"bytes", 10}}));
  ASSERT_TRUE(VTCLogStatistics(vtc::Dictionary{{"syncs", 2}}));
  EXPECT_EQ(*vtc::plist::readFile(path), vtc::Value(vtc::Dictionary{{"syncs", 2}, {"bytes", 10}}));
}

TEST(InternalNetwork, AnyInterfaceInsideThePrefixCounts) {
  using Addresses = std::optional<std::vector<std::string>>;
  auto with = [](Addresses a) {
    vtc::network::installAddressSource([a] { return a; });
    bool internal = isKorvoInternal();
    vtc::network::installAddressSource({});
    return internal;
  };
  EXPECT_TRUE(with(std::vector<std::string>{"192.168.1.4", "10.96.3.7"}));
  EXPECT_FALSE(with(std::vector<std::string>{"110.96.3.7"}));  // matched as a prefix of the text
  EXPECT_FALSE(with(std::nullopt));
  EXPECT_TRUE(vtc::network::ipv4Addresses().has_value());  // the real interfaces can be read
}

}  // namespace
