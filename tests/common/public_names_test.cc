#include <gtest/gtest.h>

#include "VantorSyncManager/PublicNames.h"
#include "common/ResultCodes.h"

TEST(PublicNames, VersionStringHasTwoBlanksAndEndsWithLineFeed) {
  EXPECT_EQ(VantorSyncManagerVersionNumber, 488.5);
  EXPECT_STREQ(VantorSyncManagerVersionString,
               "@(#)PROGRAM:VantorSyncManager  PROJECT:NubiloSyncClient-488.5\n");
}

TEST(PublicNames, ResultCodesAreNamedOrShownAsNumbers) {
  EXPECT_EQ(vtc::resultCodeName(kNBSuccess), "kNBSuccess");
  EXPECT_EQ(vtc::resultCodeName(151), "kNBServiceBusy");
  EXPECT_EQ(vtc::resultCodeName(42), "42");
  EXPECT_EQ(vtc::resultCodeName(111), "111");
}
