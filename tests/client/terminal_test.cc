// What a person at a terminal sees during a long first sync (a progress line
// redrawn in place), and what a job sees off a terminal (one summary line).
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
  EXPECT_THAT(shown.out, HasSubstr("com.korvo.Contacts: sent 0 changes, received 10000 changes, "
                                   "wrote 10000 files"));
  EXPECT_EQ(Computer::files(b.contacts()).size(), static_cast<size_t>(kCards));
}

}  // namespace
