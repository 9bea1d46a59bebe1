// Binary property lists: the writer's exact bytes for a small document, both
// directions against libplist, and damaged or hostile documents refused
// without reading outside them.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iterator>

#include "platform/plist/BinaryPlistReader.h"
#include "platform/plist/BinaryPlistWriter.h"
#include "platform/plist/PlistCodec.h"

using vtc::Array;
using vtc::Bytes;
using vtc::Dictionary;
using vtc::Value;

namespace {

Bytes encode(const Value& value) {
  Bytes out;
  vtc::plist::BinaryPlistWriter().append(value, out);
  return out;
}

// Parsed by libplist, the library every other reader of these files relies on.
Value libplistRead(const Bytes& bytes) {
  ::plist_t root = nullptr;
  plist_from_bin(reinterpret_cast<const char*>(bytes.data()), static_cast<uint32_t>(bytes.size()),
                 &root);
  Value v = *vtc::plist::fromPlist(root);
  plist_free(root);
  return v;
}

Bytes libplistWrite(const Value& value) {
  ::plist_t root = vtc::plist::toPlist(value);
  char* bin = nullptr;
  uint32_t length = 0;
  plist_to_bin(root, &bin, &length);
  Bytes out(bin, bin + length);
  std::free(bin);
  plist_free(root);
  return out;
}

Value wideValue() {
  Array many;  // past 255 objects, so references take two bytes
  for (int i = 0; i < 300; ++i) many.push_back(Value("item " + std::to_string(i)));
  return Value(Dictionary{
      {"ascii", "plain"},
      {"long", std::string(40, 'x')},  // length past the marker's nibble
      {"accents", "caf\xC3\xA9 Dvo\xC5\x99\xC3\xA1k"},
      {"astral", "smile \xF0\x9F\x98\x80"},  // a surrogate pair in UTF-16
      {"zero", 0},
      {"byte", 255},
      {"short", 65535},
      {"word", 4294967295LL},
      {"large", 1LL << 40},
      {"negative", -42},
      {"lowest", INT64_MIN},
      {"real", -3.25},
      {"yes", true},
      {"no", false},
      {"date", vtc::Date(std::chrono::seconds(1300000000) + std::chrono::microseconds(250001))},
      {"early", vtc::Date(std::chrono::seconds(-86400))},
      {"data", Bytes(20, 0xAB)},
      {"empty data", Bytes{}},
      {"empty", Array{}},
      {"nested", Dictionary{{"z", 1}, {"a", Array{Value("a"), Value(Dictionary{})}}}},
      {"many", many},
  });
}

TEST(BinaryPlist, SmallDocumentHasTheExactLayout) {
  Bytes expected = {
      'b',  'p',  'l',  'i', 's', 't', '0', '0', 0xA2, 0x01, 0x04,  // 8: array of objects 1 and 4
      0xD1, 0x02, 0x03,                         // 11: dictionary, key 2, value 3
      0x51, 'a',                                // 14: "a"
      0x10, 0x01,                               // 16: 1
      0xD1, 0x02, 0x05,                         // 18: dictionary, the same key "a", value 5
      0x10, 0x02,                               // 21: 2
      8,    11,   14,   16,  18,  21,           // 23: offset table
      0,    0,    0,    0,   0,   0,   1,   1,  // trailer: offset and reference widths
      0,    0,    0,    0,   0,   0,   0,   6,  // object count
      0,    0,    0,    0,   0,   0,   0,   0,  // top object
      0,    0,    0,    0,   0,   0,   0,   23};
  Value doc(Array{Value(Dictionary{{"a", 1}}), Value(Dictionary{{"a", 2}})});
  EXPECT_EQ(encode(doc), expected);
  EXPECT_EQ(*vtc::plist::parseBinary(expected), doc);
}

TEST(BinaryPlist, AgreesWithLibplistBothWays) {
  Value v = wideValue();
  EXPECT_EQ(libplistRead(encode(v)), v);
  EXPECT_EQ(*vtc::plist::parseBinary(libplistWrite(v)), v);
  EXPECT_EQ(*vtc::plist::parseBinary(encode(v)), v);
  // Order survives, which equality alone would not show.
  EXPECT_EQ(vtc::plist::parseBinary(encode(v))->dictionary().keys(), v.dictionary().keys());
}

TEST(BinaryPlist, WriterReusedAcrossDocumentsKeepsThemApart) {
  vtc::plist::BinaryPlistWriter writer;
  Bytes first, second;
  Array strings;  // enough distinct strings to grow the writer's table
  for (int i = 0; i < 200; ++i)
    strings.push_back(Value(std::string("s").append(std::to_string(i))));
  writer.append(Value(strings), first);
  writer.append(Value(Array{Value("s7"), Value("other"), Value("s7")}), second);
  EXPECT_EQ(*vtc::plist::parseBinary(first), Value(strings));
  EXPECT_EQ(*vtc::plist::parseBinary(second),
            Value(Array{Value("s7"), Value("other"), Value("s7")}));
  // None values have no form: left out of containers, nothing for a bare one.
  EXPECT_EQ(*vtc::plist::parseBinary(encode(Value(Array{Value(), Value(1)}))), Value(Array{1}));
  EXPECT_TRUE(encode(Value()).empty());
}

TEST(BinaryPlist, OddTextAndDatesAreReadSafely) {
  // Zero characters survive; malformed UTF-8 is written as U+FFFD, and text
  // read is always valid UTF-8: bytes past ASCII in an ASCII string and an
  // unpaired surrogate read as U+FFFD too.
  const Value withZero(std::string("a\0b", 3));
  EXPECT_EQ(*vtc::plist::parseBinary(encode(withZero)), withZero);
  EXPECT_EQ(*vtc::plist::parseBinary(encode(Value("a\xFF"))), Value("a\xEF\xBF\xBD"));
  Bytes latin = encode(Value("ab"));
  latin[10] = 0xE9;
  EXPECT_EQ(*vtc::plist::parseBinary(latin), Value("a\xEF\xBF\xBD"));
  Bytes lone = encode(Value("\xC3\xA9"));  // one UTF-16 unit: 0x00E9
  ASSERT_EQ(lone[8], 0x61);
  lone[9] = 0xD8;  // now a lone high surrogate
  EXPECT_EQ(*vtc::plist::parseBinary(lone), Value("\xEF\xBF\xBD"));
  // A date far beyond the clock's range is held at its edge, not refused.
  Bytes far = encode(Value(vtc::Date{}));
  ASSERT_EQ(far[8], 0x33);
  const uint8_t year4001[] = {0x42, 0x2D, 0x63, 0xC3, 0x7F, 0x00, 0x00, 0x00};
  std::copy(std::begin(year4001), std::end(year4001), far.begin() + 9);
  auto held = vtc::plist::parseBinary(far);
  ASSERT_TRUE(held);
  EXPECT_GT(held->date(), vtc::Date(std::chrono::hours(24 * 365 * 280)));
}

TEST(BinaryPlist, DamagedAndHostileDocumentsAreRefused) {
  const Bytes good = encode(Value(Array{Value("ab"), Value(7)}));
  // bplist00 | A2 01 02 | 52 'a' 'b' | 10 07 | table 08 0B 0E | trailer
  ASSERT_EQ(good.size(), 8u + 3 + 3 + 2 + 3 + 32);
  auto damaged = [&](std::initializer_list<std::pair<size_t, uint8_t>> changes) {
    Bytes b = good;
    for (auto [at, byte] : changes) b[at] = byte;
    return vtc::plist::parseBinary(b);
  };
  EXPECT_TRUE(vtc::plist::parseBinary(good));
  EXPECT_FALSE(vtc::plist::parseBinary(Bytes(good.begin(), good.end() - 1)));  // cut trailer
  EXPECT_FALSE(damaged({{9, 0x03}}));              // a reference past the object count
  EXPECT_FALSE(damaged({{9, 0x00}}));              // the array contains itself
  EXPECT_FALSE(damaged({{11, 0x5F}}));             // a length that is not an integer object
  EXPECT_FALSE(damaged({{14, 0x15}}));             // a 32-byte integer
  EXPECT_FALSE(damaged({{17, 0x12}}));             // an object inside the offset table
  EXPECT_FALSE(damaged({{good.size() - 9, 3}}));   // the top object past the count
  EXPECT_FALSE(damaged({{good.size() - 24, 1}}));  // an absurd object count
  EXPECT_FALSE(damaged({{8, 0xD1}, {9, 0x02}}));   // a dictionary keyed by an integer

  // A chain of arrays each holding the next one twice would expand to 2^60
  // values; the reader gives up after a bounded amount of work.
  Bytes bomb = {'b', 'p', 'l', 'i', 's', 't', '0', '0'};
  const int levels = 60;
  for (int i = 0; i < levels; ++i) {
    bomb.insert(bomb.end(), {0xA2, static_cast<uint8_t>(i + 1), static_cast<uint8_t>(i + 1)});
  }
  bomb.push_back(0x09);  // the innermost value: true
  for (int i = 0; i <= levels; ++i) bomb.push_back(static_cast<uint8_t>(8 + 3 * i));
  const size_t tableAt = 8 + 3 * levels + 1;
  Bytes trailer(32, 0);
  trailer[6] = 1;
  trailer[7] = 1;
  trailer[15] = levels + 1;
  trailer[30] = static_cast<uint8_t>(tableAt >> 8);
  trailer[31] = static_cast<uint8_t>(tableAt);
  bomb.insert(bomb.end(), trailer.begin(), trailer.end());
  EXPECT_FALSE(vtc::plist::parseBinary(bomb));
}

// A document of count objects: object i at its offset, one-byte references
// and offsets; the top object is 0.
Bytes document(const std::vector<Bytes>& objects) {
  Bytes doc = {'b', 'p', 'l', 'i', 's', 't', '0', '0'};
  Bytes table;
  for (const Bytes& object : objects) {
    table.push_back(static_cast<uint8_t>(doc.size()));
    doc.insert(doc.end(), object.begin(), object.end());
  }
  const size_t tableAt = doc.size();
  doc.insert(doc.end(), table.begin(), table.end());
  Bytes trailer(32, 0);
  trailer[6] = 1;
  trailer[7] = 1;
  trailer[15] = static_cast<uint8_t>(objects.size());
  trailer[30] = static_cast<uint8_t>(tableAt >> 8);
  trailer[31] = static_cast<uint8_t>(tableAt);
  doc.insert(doc.end(), trailer.begin(), trailer.end());
  return doc;
}

// An object reachable from itself is refused before anything of it is built;
// one reached from several places is not a cycle.
TEST(BinaryPlist, ObjectsThatLeadBackToThemselvesAreRefused) {
  Bytes self = {'b', 'p', 'l', 'i', 's', 't', '0', '0', 0xAF, 0x12, 0x00, 0x0F, 0x42, 0x40};
  self.insert(self.end(), 1000000, 0);  // the array holding itself a million times
  const size_t tableAt = self.size();
  self.push_back(8);
  Bytes trailer(32, 0);
  trailer[6] = 1;
  trailer[7] = 1;
  trailer[15] = 1;
  for (int i = 0; i < 8; ++i) trailer[31 - i] = static_cast<uint8_t>(tableAt >> (8 * i));
  self.insert(self.end(), trailer.begin(), trailer.end());
  const auto start = std::chrono::steady_clock::now();
  EXPECT_FALSE(vtc::plist::parseBinary(self));
  EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::milliseconds(500));

  const Bytes key = {0x51, 'k'};
  // array 0 -> array 1 -> array 0
  EXPECT_FALSE(vtc::plist::parseBinary(document({{0xA1, 1}, {0xA2, 2, 0}, {0x09}})));
  // dictionary 0 -> array 1 -> dictionary 2 -> dictionary 0, through a value
  EXPECT_FALSE(vtc::plist::parseBinary(
      document({{0xD1, 3, 1}, {0xA1, 2}, {0xD2, 3, 3, 4, 0}, key, {0x09}})));
  // array 0 holds array 1 twice and array 1 holds a string: shared, no cycle
  auto shared = vtc::plist::parseBinary(document({{0xA2, 1, 1}, {0xA1, 2}, key}));
  ASSERT_TRUE(shared);
  EXPECT_EQ(*shared, Value(Array{Value(Array{Value("k")}), Value(Array{Value("k")})}));
}

// Whatever the writer accepts the reader reads: nesting stops at the depth
// the reader reads, and long strings are not shared beyond what its budget
// allows.
TEST(BinaryPlist, TheWriterStaysWithinWhatTheReaderReads) {
  auto nested = [](unsigned containers) {
    Value v("innermost");
    for (unsigned i = 0; i < containers; ++i)
      v = i % 2 ? Value(Array{v}) : Value(Dictionary{{"k", v}});
    return v;
  };
  const Value deepest = nested(128);  // the top at depth 0, the string at 128
  EXPECT_EQ(*vtc::plist::parseBinary(encode(deepest)), deepest);
  Bytes out = {7};
  EXPECT_THAT([&] { vtc::plist::BinaryPlistWriter().append(nested(129), out); },
              testing::ThrowsMessage<std::invalid_argument>(
                  "Cannot write a property list nested deeper than 128 levels: readers refuse it"));
  EXPECT_EQ(out, Bytes{7});
  // Empty containers hold nothing deeper, at any depth the reader reaches.
  Value emptyAtTheBottom(Array{});
  for (int i = 0; i < 128; ++i) emptyAtTheBottom = Value(Array{emptyAtTheBottom});
  EXPECT_EQ(*vtc::plist::parseBinary(encode(emptyAtTheBottom)), emptyAtTheBottom);

  const Value longText(std::string(5000, 'x'));
  const Value repeated(Array(2000, longText));
  EXPECT_EQ(*vtc::plist::parseBinary(encode(repeated)), repeated);
  const Value shortText("short");  // short strings are still written once
  EXPECT_LT(encode(Value(Array(2000, shortText))).size(), 2000u * 2 + 100);
}

// Found by fuzzing: whatever the reader accepts, writing it and reading it
// again gives the same document.
TEST(BinaryPlist, InputsFoundByFuzzingSettleAfterOneRewrite) {
  size_t files = 0;
  for (const auto& entry :
       std::filesystem::directory_iterator(std::string(VSM_TEST_DATA) + "/platform/plist/data")) {
    ++files;
    std::ifstream in(entry.path(), std::ios::binary);
    Bytes input((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
    auto value = vtc::plist::parseBinary(input);
    ASSERT_TRUE(value) << entry.path();
    Bytes once = encode(*value);
    EXPECT_EQ(encode(*vtc::plist::parseBinary(once)), once) << entry.path();
  }
  EXPECT_GE(files, 1u);
}

}  // namespace
