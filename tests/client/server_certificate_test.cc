// HTTPS with a server that has an authority of its own: refused until setup
// is given that authority, then trusted; a certificate that changes after
// setup is refused, with a sentence that says how to trust the new one.
#include <gmock/gmock.h>

#include "localshare/ApacheShare.h"
#include "localshare/Computer.h"
#include "support/TestHome.h"

using testing::HasSubstr;
using vtc::local::ApacheShare;
using vtc::local::Computer;

namespace {

class ServerCertificate : public ::testing::Test {
 protected:
  vtc::test::TestHome home;
  ApacheShare share{ApacheShare::Options{.tls = true}};
  std::string url = share.url("/sync");
  Computer mac{"Mac A"};

  Computer::Result setup(const std::vector<std::string>& more = {}) {
    std::vector<std::string> args{"setup",
                                  url,
                                  "--user",
                                  ApacheShare::kUser,
                                  "--password-command",
                                  std::string("printf ") + ApacheShare::kPassword};
    args.insert(args.end(), more.begin(), more.end());
    return mac.run(args);
  }
};

TEST_F(ServerCertificate, TrustedThroughItsAuthorityAtSetupThenPinnedUntilSetupAgain) {
  Computer::Result untrusted = setup();
  EXPECT_EQ(untrusted.status, 8);
  EXPECT_THAT(untrusted.err, HasSubstr("has a certificate that no authority this computer trusts "
                                       "vouches for; if the server has an authority of its own, "
                                       "give that authority's certificate with `nubilosyncclient "
                                       "setup " +
                                       url + " --user alice --ca-file PATH`"));
  EXPECT_THAT(setup({"--ca-file", share.caFile() + ".missing"}).err,
              HasSubstr("There is no certificate file"));

  Computer::Result trusted = setup({"--ca-file", share.caFile()});
  ASSERT_EQ(trusted.status, 0) << trusted.err;
  Computer::write(mac.contacts() + "/ann.vcf",
                  "BEGIN:VCARD\r\nVERSION:3.0\r\nUID:ann\r\nFN:Ann\r\nEND:VCARD\r\n");
  ASSERT_EQ(mac.run({"add", "contacts", mac.contacts()}).status, 0);
  Computer::Result synced = mac.run({"sync"});
  EXPECT_EQ(synced.status, 0) << synced.err;

  // The same authority signs a new certificate: not the one accepted.
  share.renewCertificate();
  Computer::Result changed = mac.run({"sync"});
  EXPECT_EQ(changed.status, 8);
  EXPECT_THAT(changed.err, HasSubstr("The server at " + url +
                                     " shows a certificate other than the one this computer "
                                     "accepted at setup (its SHA-256 digest is now "));
  EXPECT_THAT(changed.err, HasSubstr("check the new one, then run `nubilosyncclient setup " + url +
                                     " --user alice` again to trust it."));
  ASSERT_EQ(setup({"--ca-file", share.caFile()}).status, 0);
  synced = mac.run({"sync"});
  EXPECT_EQ(synced.status, 0) << synced.err;
}

}  // namespace
