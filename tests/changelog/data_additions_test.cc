// Byte helpers: big-endian integers, strings, the reduced gzip envelope and
// control-character stripping.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <zlib.h>

#include "VantorSyncManager/NubiloDataAdditions.h"
#include "VantorSyncManager/NubiloException.h"
#include "VantorSyncManager/PublicNames.h"

using vtc::Bytes;

TEST(DataAdditions, IntegersAreBigEndianAndReadsAreBounded) {
  Bytes b;
  NubiloAppendUInt32(b, 101);
  NubiloAppendUInt32(b, 0xDEADBEEF);
  EXPECT_EQ(b, (Bytes{0, 0, 0, 101, 0xDE, 0xAD, 0xBE, 0xEF}));
  EXPECT_EQ(NubiloUInt32AtOffset(b, 0), 101u);
  EXPECT_EQ(NubiloUInt32AtOffset(b, 4), 0xDEADBEEFu);
  try {
    NubiloUInt32AtOffset(b, 5);
    FAIL() << "read past the end";
  } catch (const NubiloException& e) {
    EXPECT_EQ(e.name(), NubiloCorruptChangelogException);
    EXPECT_EQ(e.reason(),
              "Attempting to parse value beyond bounds of changelog data length:8 offset:5");
  }
  EXPECT_THAT([&] { NubiloUInt32AtOffset(b, 0xFFFFFFFF); },  // no wrap-around
              testing::ThrowsMessage<NubiloException>(
                  "NubiloCorruptChangelogException: Attempting to parse value beyond bounds of "
                  "changelog data length:8 offset:4294967295"));
  Bytes s;
  NubiloAppendString(s, "");
  NubiloAppendString(s, "h\xC3\xA9");
  EXPECT_EQ(s, (Bytes{0, 'h', 0xC3, 0xA9, 0}));
}

TEST(DataAdditions, TheGzipEnvelopeHasTheFixedHeaderAndNoTrailer) {
  Bytes text(10000, 'a');
  auto zipped = NubiloGzip(text);
  ASSERT_TRUE(zipped);
  EXPECT_EQ(Bytes(zipped->begin(), zipped->begin() + 10),
            (Bytes{0x1F, 0x8B, 0x08, 0, 0, 0, 0, 0, 0, 0x03}));
  EXPECT_EQ(NubiloCopyGunzip(*zipped), text);

  auto empty = NubiloGzip(Bytes{});
  ASSERT_TRUE(empty);
  EXPECT_EQ(NubiloCopyGunzip(*empty), Bytes{});  // empty, not nothing
  EXPECT_FALSE(NubiloCopyGunzip(Bytes(9, 0)));
  EXPECT_FALSE(NubiloCopyGunzip(Bytes(10, 0)));
  // A deflate stream that does not reach its end is no body, however little
  // is missing.
  for (ptrdiff_t cut : {1, 3}) {
    Bytes truncated(zipped->begin(), zipped->end() - cut);
    EXPECT_FALSE(NubiloCopyGunzip(truncated)) << cut;
  }
  EXPECT_FALSE(NubiloCopyGunzip(Bytes(zipped->begin(), zipped->begin() + 12)));
  Bytes corrupt = *zipped;
  corrupt[10] ^= 0xFF;
  EXPECT_FALSE(NubiloCopyGunzip(corrupt));
}

TEST(DataAdditions, AStandardGzipFileDecodesItsTrailerIgnored) {
  Bytes text = {'s', 'y', 'n', 'c', ' ', 'd', 'a', 't', 'a'};
  Bytes out(256);
  z_stream z{};
  deflateInit2(&z, 9, Z_DEFLATED, 15 + 16, 8, Z_DEFAULT_STRATEGY);  // a real gzip wrapper
  z.next_in = text.data();
  z.avail_in = static_cast<uInt>(text.size());
  z.next_out = out.data();
  z.avail_out = static_cast<uInt>(out.size());
  ASSERT_EQ(deflate(&z, Z_FINISH), Z_STREAM_END);
  out.resize(z.total_out);
  deflateEnd(&z);
  EXPECT_EQ(NubiloCopyGunzip(out), text);
}

TEST(DataAdditions, ControlCharactersOfEveryKindAreStripped) {
  EXPECT_EQ(NubiloStringByStrippingControlCharacters("Alice's\tMac\n"), "Alice'sMac");
  EXPECT_EQ(NubiloStringByStrippingControlCharacters("plain name"), "plain name");
  // C1 control U+0085, soft hyphen U+00AD and zero-width joiner U+200D (Cf),
  // but not the letters around them.
  EXPECT_EQ(NubiloStringByStrippingControlCharacters("a\xC2\x85"
                                                     "b\xC2\xAD"
                                                     "c\xE2\x80\x8D"
                                                     "d\xC3\xA9"),
            "abcd\xC3\xA9");
  EXPECT_EQ(NubiloStringByStrippingControlCharacters("\x01\x7F"), "");
}
