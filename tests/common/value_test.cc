// Property-list values: round trips of every kind through files and both
// encodings, the readers' conversions, dictionary order and equality, and
// the text form. The binary encoding's own cases are in binary_plist_test.
#include <gtest/gtest.h>

#include "VantorSyncManager/Value.h"
#include "platform/plist/PlistCodec.h"
#include "support/TestHome.h"

using vtc::Array;
using vtc::Bytes;
using vtc::Dictionary;
using vtc::Value;

namespace {

Value everyKind() {
  return Value(Dictionary{{"string", "caf\xC3\xA9 <&>"},
                          {"negative", -42},
                          {"large", 1LL << 40},
                          {"real", 3.25},
                          {"yes", true},
                          {"no", false},
                          {"date", vtc::Date(std::chrono::seconds(1300000000))},
                          {"data", Bytes{0, 1, 2, 255}},
                          {"array", Array{Value("a"), Value(1), Value(Array{})}},
                          {"nested", Dictionary{{"z", 1}, {"a", 2}}}});
}

TEST(Value, RoundTripsThroughAnAtomicallyWrittenFileAndTheBinaryForm) {
  vtc::test::TestHome home;
  std::string path = home.path() + "/prefs.plist";
  EXPECT_FALSE(vtc::plist::readFile(path));
  ASSERT_TRUE(vtc::plist::writeFileAtomically(path, everyKind()));
  auto back = vtc::plist::readFile(path);
  ASSERT_TRUE(back);
  EXPECT_EQ(*back, everyKind());
  // Order survives too, which equality alone would not show.
  EXPECT_EQ(back->dictionary().get("nested").dictionary().keys(),
            (std::vector<std::string>{"z", "a"}));
  EXPECT_EQ(*vtc::plist::parse(vtc::plist::toBinary(everyKind())), everyKind());
  EXPECT_FALSE(vtc::plist::parse(Bytes{'n', 'o', 'p', 'e'}));
  EXPECT_FALSE(vtc::plist::writeFileAtomically(home.path() + "/missing/dir/x.plist", everyKind()));
}

TEST(Value, ReadersConvertLikeAPropertyListReader) {
  EXPECT_EQ(Value("42abc").integer(), 42);
  EXPECT_EQ(Value(" 7").integer(), 7);
  EXPECT_EQ(Value(2.9).integer(), 2);
  for (const char* yes : {"YES", "true", "1"}) EXPECT_TRUE(Value(yes).boolean()) << yes;
  for (const char* no : {"0", "no", ""}) EXPECT_FALSE(Value(no).boolean()) << no;
  EXPECT_EQ(Value(5).string(), "");  // not a string
  EXPECT_TRUE(Value(static_cast<const char*>(nullptr)).isNone());
}

TEST(Value, DictionaryKeepsOrderAndComparesWithout) {
  Dictionary d{{"b", 1}, {"a", 2}};
  d.set("c", 3);
  d.set("b", 9);  // replaced in place
  EXPECT_EQ(d.keys(), (std::vector<std::string>{"b", "a", "c"}));
  EXPECT_TRUE(d.erase("a"));
  EXPECT_FALSE(d.erase("a"));
  EXPECT_EQ(d.get("c").integer(), 3);  // lookups survive erasure
  EXPECT_EQ(d, (Dictionary{{"c", 3}, {"b", 9}}));
  EXPECT_NE(d, (Dictionary{{"c", 3}, {"b", "9"}}));
  Value copy = Value(d);
  copy.mutableDictionary().set("new", 1);
  EXPECT_FALSE(d.contains("new"));  // copies are deep
}

TEST(Value, DescriptionIsTheOldStyleText) {
  Value v(Dictionary{{"name", "two words"}, {"n", 3}, {"list", Array{Value("a")}}});
  EXPECT_EQ(v.description(),
            "{\n    name = \"two words\";\n    n = 3;\n    list = (\n        a\n    );\n}");
  EXPECT_EQ(Value(Bytes{1, 2, 3, 4, 5}).description(), "<01020304 05>");
}

}  // namespace
