// HTTPS against the share: certificates are checked against the system's CA
// store, which SSL_CERT_FILE can point at a private authority.
#include <gtest/gtest.h>

#include <cstdlib>
#include <optional>
#include <string>

#include "VantorSyncManager/NubiloException.h"
#include "VantorSyncManager/NubiloRemoteSession.h"
#include "VantorSyncManager/PublicNames.h"
#include "support/ApacheShare.h"
#include "support/FakeTime.h"
#include "support/TestHome.h"

namespace {

class ScopedEnv {
 public:
  ScopedEnv(const char* name, const std::string& value) : name_(name) {
    if (const char* v = std::getenv(name)) previous_ = v;
    ::setenv(name, value.c_str(), 1);
  }
  ~ScopedEnv() {
    if (previous_)
      ::setenv(name_, previous_->c_str(), 1);
    else
      ::unsetenv(name_);
  }

 private:
  const char* name_;
  std::optional<std::string> previous_;
};

TEST(Https, ASessionTrustsWhatTheCaStoreTrustsAndNothingElse) {
  vtc::test::TestHome home;
  vtc::test::FakeTime time;
  vtc::test::ApacheShare::Options options;
  options.tls = true;
  vtc::test::ApacheShare share(options);
  vtc::Dictionary config = share.configuration();
  config.set("max_lock_acquire_attempts", vtc::Value(0));
  {
    // Unknown authority: the connection is refused as a network failure.
    try {
      NubiloRemoteSession::sessionWithUsername("alice", "wonderland", config);
      FAIL() << "an untrusted certificate was accepted";
    } catch (const NubiloException& e) {
      EXPECT_EQ(e.name(), NubiloNetworkFailureException);
    }
  }
  ScopedEnv trust("SSL_CERT_FILE", share.caFile());
  auto session = NubiloRemoteSession::sessionWithUsername("alice", "wonderland", config);
  EXPECT_EQ(session->respondingServer(), "dav-test-1");
}

}  // namespace
