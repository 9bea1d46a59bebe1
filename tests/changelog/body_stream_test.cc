// The changelog body read as a stream: every inflated byte is looked at once,
// however long a string runs without its terminating zero.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <chrono>

#include "VantorSyncManager/NubiloDataAdditions.h"
#include "VantorSyncManager/NubiloException.h"
#include "changelog/BodyStream.h"

using vtc::Bytes;

namespace {

TEST(BodyStream, AnUnterminatedIdentifierIsScannedOnce) {
  // Grown 64 bytes at a time, a 4 MiB run rescanned from its start at every
  // step would take 2^16 scans of up to 4 MiB each.
  const Bytes zipped = *NubiloGzip(Bytes(4 << 20, 'x'));
  vtc::clog::BodyStream body(
      zipped, [](const uint8_t*, const uint8_t*) {}, {}, 64);
  const auto start = std::chrono::steady_clock::now();
  EXPECT_THAT([&] { body.readCString(); },
              testing::ThrowsMessage<NubiloException>(
                  testing::HasSubstr("unterminated record identifier in changelog body")));
  EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(1));
}

TEST(BodyStream, RecordsAcrossManySmallStepsReadWhole) {
  Bytes plain;
  NubiloAppendString(plain, std::string(300, 'a'));
  NubiloAppendUInt32(plain, 7);
  plain.insert(plain.end(), 200, 0xEE);
  NubiloAppendString(plain, "b");
  const Bytes zipped = *NubiloGzip(plain);
  vtc::clog::BodyStream body(
      zipped, [](const uint8_t*, const uint8_t*) {}, {}, 16);
  EXPECT_EQ(body.readCString(), std::string(300, 'a'));
  EXPECT_EQ(body.readUInt32(), 7u);
  const vtc::ByteView run = body.read(200);
  EXPECT_EQ(Bytes(run.begin(), run.end()), Bytes(200, 0xEE));
  EXPECT_EQ(body.readCString(), "b");
  body.finish();
  EXPECT_THAT([&] { body.readUInt32(); },
              testing::ThrowsMessage<NubiloException>(
                  testing::HasSubstr("changelog data length:507 offset:507")));
}

}  // namespace
