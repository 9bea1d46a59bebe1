// The formatter behind "%@" and the log's message texts.
#include <gtest/gtest.h>

#include <set>

#include "common/Format.h"

namespace {

struct Described {
  std::string description() const { return "<described>"; }
};

TEST(Format, ObjectPlaceholderTakesAnythingWithATextFormAndPrintfConversionsFollowTheType) {
  EXPECT_EQ(vtc::format("%@ %@ %@ %s", std::string("s"), "c", 12, std::string("v")), "s c 12 v");
  EXPECT_EQ(vtc::format("[%@]", Described{}), "[<described>]");
  EXPECT_EQ(vtc::format("%@", vtc::Value("plain")), "plain");
  EXPECT_EQ(vtc::format("%@", vtc::Value()), "(null)");
  EXPECT_EQ(vtc::format("%@", std::optional<std::string>()), "(null)");
  EXPECT_EQ(vtc::format("%@", std::set<std::string>{"b", "a"}), "(a, b)");
  EXPECT_EQ(vtc::format("%@ and %@", "one"), "one and (null)");  // missing arguments
  EXPECT_EQ(vtc::format("VantorSyncClient-%@", 488.5), "VantorSyncClient-488.5");
  EXPECT_EQ(vtc::format("%05i.clog", 7), "00007.clog");
  EXPECT_EQ(vtc::format("%d|%ld|%u|%x", -3, 4L, 5u, 0xBEEFu), "-3|4|5|beef");
  EXPECT_EQ(vtc::format("100%% of %@", "it"), "100% of it");
  EXPECT_EQ(vtc::format("%d", std::string("text")), "text");  // mismatches degrade to text
  EXPECT_EQ(vtc::format("tail %"), "tail %");
}

}  // namespace
