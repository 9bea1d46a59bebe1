// Lock records as other clients read them back from a server: whatever text
// the property holds, a record comes out whole or not at all, and the owner
// it names yields the fields of a sync lock owner.
#include <gtest/gtest.h>

#include "platform/dav/DavMultistatus.h"
#include "platform/dav/LockRecord.h"

namespace {

TEST(LockRecord, ComesBackWholeOrNotAtAll) {
  const vtc::LockRecord written{"opaquelocktoken:1-2", 1764000000,
                                "<SY:synclockinfo xmlns:SY='urn:s'>\n<SY:clientid>G</SY:clientid>"
                                "</SY:synclockinfo>"};
  std::optional<vtc::LockRecord> read = vtc::LockRecord::parse(written.text());
  ASSERT_TRUE(read);
  EXPECT_EQ(read->token, written.token);
  EXPECT_EQ(read->expires, written.expires);
  EXPECT_EQ(read->owner, written.owner);  // line breaks in the owner stay

  for (const char* text :
       {"", "token-only", "\n1764000000\nowner", "t\n17640x\nowner", "t\n\nowner", "t\n1764000000"})
    EXPECT_FALSE(vtc::LockRecord::parse(text)) << text;
}

TEST(LockRecord, AnOwnerTextYieldsTheFieldsOfASyncLockOwnerOnly) {
  vtc::Dictionary fields = vtc::ownerFields(
      "<SY:synclockinfo xmlns:SY='urn:s'><SY:lock-user>alice</SY:lock-user><SY:clientid>G&amp;1"
      "</SY:clientid></SY:synclockinfo>");
  EXPECT_EQ(fields.get("lock-user").string(), "alice");
  EXPECT_EQ(fields.get("clientid").string(), "G&1");
  EXPECT_TRUE(vtc::ownerFields("plain text").empty());
  EXPECT_TRUE(vtc::ownerFields("<unclosed>").empty());
  EXPECT_TRUE(vtc::ownerFields("").empty());
}

TEST(LockRecord, AnAnswerWithoutAReadableDateHasNoServerTime) {
  EXPECT_EQ(vtc::serverTime("Sun, 06 Nov 1994 08:49:37 GMT"), 784111777);
  EXPECT_FALSE(vtc::serverTime(""));
  EXPECT_FALSE(vtc::serverTime("yesterday"));
}

}  // namespace
