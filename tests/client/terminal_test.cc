// What a person at a terminal sees: a long first sync's progress line
// redrawn in place with counts, bytes and the time left (and what a job sees
// off a terminal: one summary line); a dry run that names each item; status
// after a sync that could not reach the server.
#include <gmock/gmock.h>

#include <regex>
#include <set>

#include "localshare/ApacheShare.h"
#include "localshare/Computer.h"
#include "support/TestHome.h"

using testing::HasSubstr;
using vtc::local::ApacheShare;
using vtc::local::Computer;

namespace {

TEST(Terminal, AFirstSyncOfTenThousandCardsRedrawsItsProgressLineAndAJobGetsOneLine) {
  vtc::test::TestHome home;
  ApacheShare share;
  const std::string url = "http://127.0.0.1:" + std::to_string(share.port()) + "/sync";
  Computer a{"Mac A"}, b{"Mac B"};
  a.join(url, ApacheShare::kUser, ApacheShare::kPassword);
  b.join(url, ApacheShare::kUser, ApacheShare::kPassword);
  constexpr int kCards = 10000;
  for (int i = 0; i < kCards; ++i)
    Computer::write(a.contacts() + "/p" + std::to_string(i) + ".vcf",
                    "BEGIN:VCARD\r\nVERSION:3.0\r\nUID:p" + std::to_string(i) + "\r\nFN:Person " +
                        std::to_string(i) + "\r\nEND:VCARD\r\n");

  // Off a terminal: one line, nothing on standard error.
  Computer::Result job = a.run({"--sync", "--periodic"});
  EXPECT_EQ(job.status, 0);
  EXPECT_EQ(job.out, "Synced 2 folders: sent 10000 changes, received 0 changes, wrote 0 files.\n");
  EXPECT_EQ(job.err, "");

  // On a terminal: the line is drawn again and again in place, with counts
  // that grow, then cleared before the per-folder lines.
  Computer::Result shown = b.runOnTerminal({"sync"});
  EXPECT_EQ(shown.status, 0) << shown.out;
  std::set<int> counts;
  std::regex drawn("\r\x1b\\[Kcom\\.korvo\\.Contacts: writing files ([0-9]+)/10000");
  for (std::sregex_iterator it(shown.out.begin(), shown.out.end(), drawn), end; it != end; ++it)
    counts.insert(std::stoi((*it)[1]));
  EXPECT_GE(counts.size(), 2u) << shown.out.substr(0, 2000);
  // Bytes and the time left, once the step has run long enough to tell.
  EXPECT_THAT(shown.out, testing::ContainsRegex("writing files [0-9]+/10000, [0-9.]+ [KM]B, "
                                                "about [0-9]+ s left"));
  EXPECT_THAT(shown.out, HasSubstr("com.korvo.Contacts: sent 0 changes, received 10000 changes, "
                                   "wrote 10000 files"));
  EXPECT_EQ(Computer::files(b.contacts()).size(), static_cast<size_t>(kCards));
}

TEST(Terminal, ADryRunNamesEachItemAndStatusAfterAnUnreachableServerSaysWhy) {
  vtc::test::TestHome home;
  ApacheShare share;
  const std::string origin = "http://127.0.0.1:" + std::to_string(share.port());
  Computer a{"Mac A"}, b{"Mac B"};
  a.join(origin + "/sync", ApacheShare::kUser, ApacheShare::kPassword);
  b.join(origin + "/sync", ApacheShare::kUser, ApacheShare::kPassword);
  Computer::write(a.contacts() + "/ann.vcf",
                  "BEGIN:VCARD\r\nVERSION:3.0\r\nUID:ann\r\nFN:Ann Smith\r\nEND:VCARD\r\n");
  Computer::write(a.calendars() + "/talk.ics",
                  "BEGIN:VCALENDAR\r\nVERSION:2.0\r\nPRODID:-//t//t//EN\r\nBEGIN:VEVENT\r\n"
                  "UID:talk\r\nDTSTAMP:20260101T000000Z\r\nDTSTART:20260105T100000Z\r\n"
                  "SUMMARY:Team talk\r\nEND:VEVENT\r\nEND:VCALENDAR\r\n");
  ASSERT_EQ(a.run({"sync"}).status, 0);

  Computer::Result dry = b.runOnTerminal({"sync", "--dry-run"});
  EXPECT_EQ(dry.status, 0) << dry.out;
  EXPECT_THAT(dry.out, HasSubstr("com.korvo.Contacts (dry run): would send 0 changes, receive 1 "
                                 "change and write 1 file (slow sync)\r\n"
                                 "  Ann Smith (ann.vcf): would be added here\r\n"));
  EXPECT_THAT(dry.out, HasSubstr("  Team talk (talk.ics): would be added here\r\n"));
  EXPECT_TRUE(Computer::files(b.contacts()).empty());

  share.stop();
  Computer::Result failed = b.runOnTerminal({"sync"});
  EXPECT_EQ(failed.status, 4);
  Computer::Result status = b.runOnTerminal({"status"});
  EXPECT_THAT(status.out, HasSubstr("last sync never; last attempt 20"));
  EXPECT_THAT(status.out, HasSubstr("1 failed sync since: Cannot reach the server at " + origin +
                                    " (connection refused); check the address and the "
                                    "network."));
  EXPECT_THAT(status.out, HasSubstr("Log: ~/Library/Logs/Sync/nubilosync.log"));
}

}  // namespace
