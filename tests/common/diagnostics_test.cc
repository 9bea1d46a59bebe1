// Message traces in the journal (or the capture seam where none runs), the
// statistics file, and the internal-network test.
#include <gtest/gtest.h>

#include <systemd/sd-journal.h>
#include <unistd.h>

#include <cstdio>
#include <filesystem>

#include "VantorSyncManager/Diagnostics.h"
#include "common/Uuid.h"
#include "platform/network/InterfaceAddresses.h"
#include "platform/plist/PlistCodec.h"
#include "support/TestHome.h"
#include "support/TraceCapture.h"

using vtc::test::TraceCapture;

namespace {

bool journalRuns() {
  return ::access("/run/systemd/journal/socket", W_OK) == 0;
}

// The record with this uuid field, read back from the journal; empty if none.
std::string journalMessageWithUuid(const std::string& uuid) {
  sd_journal* j = nullptr;
  if (sd_journal_open(&j, SD_JOURNAL_LOCAL_ONLY) < 0) return {};
  std::string match = "COM_KORVO_MESSAGE_UUID=" + uuid;
  sd_journal_add_match(j, match.c_str(), 0);
  std::string message;
  for (int tries = 0; tries < 50 && message.empty(); ++tries) {
    sd_journal_wait(j, 20000);
    while (sd_journal_next(j) > 0) {
      const void* data = nullptr;
      size_t len = 0;
      if (sd_journal_get_data(j, "MESSAGE", &data, &len) == 0)
        message.assign(static_cast<const char*>(data) + 8, len - 8);
    }
  }
  sd_journal_close(j);
  return message;
}

TEST(MessageTrace, WritesOneFieldPerKeyAndSkipsNullOnes) {
  std::string uuid = vtc::makeUUIDString();
  if (journalRuns()) {
    std::printf("message trace checked through the system journal\n");
    VTCMessageTrace("com.korvo.test", "sig", nullptr, nullptr, nullptr, uuid.c_str(), "1", nullptr,
                    "hello journal", "event");
    EXPECT_EQ(journalMessageWithUuid(uuid), "hello journal");
    return;
  }
  std::printf("no journal runs here: message trace checked through the capture seam\n");
  TraceCapture capture;
  VTCMessageTrace("com.korvo.test", "sig", nullptr, nullptr, nullptr, uuid.c_str(), "1", nullptr,
                  "hello journal", "event");
  auto records = capture.records();
  ASSERT_EQ(records.size(), 1u);
  std::vector<std::string> fields;
  for (const auto& [k, v] : records[0]) fields.push_back(k);
  EXPECT_EQ(fields,
            (std::vector<std::string>{"COM_KORVO_MESSAGE_DOMAIN", "COM_KORVO_MESSAGE_SIGNATURE",
                                      "COM_KORVO_MESSAGE_UUID", "COM_KORVO_MESSAGE_VALUE",
                                      "COM_KORVO_MESSAGE_EVENT", "PRIORITY", "MESSAGE"}));
  EXPECT_EQ(TraceCapture::field(records[0], "PRIORITY"), "6");
}

TEST(MessageTrace, FailuresGoToStandardError) {
  TraceCapture capture;
  testing::internal::CaptureStderr();
  VTCMessageTrace(nullptr, "sig", nullptr, nullptr, "noop", nullptr, nullptr, nullptr, "m",
                  nullptr);
  std::string err = testing::internal::GetCapturedStderr();
  EXPECT_TRUE(capture.records().empty());
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
  std::filesystem::permissions(
      home.path() + "/Library/Logs/Sync",
      std::filesystem::perms::owner_read | std::filesystem::perms::owner_exec);
  if (::geteuid() != 0) {
    EXPECT_FALSE(VTCLogStatistics(vtc::Dictionary{{"x", 1}}));  // root writes anyway
  }
  std::filesystem::permissions(home.path() + "/Library/Logs/Sync",
                               std::filesystem::perms::owner_all);
}

TEST(InternalNetwork, AnyInterfaceInsideThePrefixCounts) {
  using Addresses = std::optional<std::vector<std::string>>;
  auto with = [](Addresses a) {
    vtc::network::installAddressSource([a] { return a; });
    bool internal = isKorvoInternal();
    vtc::network::installAddressSource({});
    return internal;
  };
  EXPECT_FALSE(with(std::vector<std::string>{"192.168.1.4"}));
  EXPECT_TRUE(with(std::vector<std::string>{"192.168.1.4", "10.96.3.7"}));
  EXPECT_FALSE(with(std::vector<std::string>{"110.96.3.7"}));  // matched as a prefix of the text
  EXPECT_FALSE(with(std::vector<std::string>{}));
  EXPECT_FALSE(with(std::nullopt));
  EXPECT_TRUE(vtc::network::ipv4Addresses().has_value());  // the real interfaces can be read
}

}  // namespace
