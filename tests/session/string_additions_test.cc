#include <gtest/gtest.h>

#include "VantorSyncManager/StringAdditions.h"

TEST(StringAdditions, XmlQuotingEscapesAmpersandFirstAndLeavesApostrophes) {
  EXPECT_EQ(stringByXMLQuoting("a<b & c"), "a&lt;b &amp; c");
  EXPECT_EQ(stringByXMLQuoting("\"word\""), "&quot;word&quot;");
  EXPECT_EQ(stringByXMLQuoting("it's &amp;"), "it's &amp;amp;");
}

TEST(StringAdditions, PathComponentsAreJoinedWithoutNormalising) {
  EXPECT_EQ(stringByAppendingTesselPathComponent("/a/b", "Clients"), "/a/b/Clients");
  EXPECT_EQ(stringByAppendingTesselPathComponent("/a/b", "/x"), "/a/b//x");
  EXPECT_EQ(stringByAppendingTesselPathComponent("/a/b", ""), "/a/b/");
}
