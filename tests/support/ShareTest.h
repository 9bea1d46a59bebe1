// The common ground of the session tests: a temporary home, its log read
// back (at Info), fake time, captured message traces and a private share,
// and sessions opened on it.
#pragma once

#include <gtest/gtest.h>

#include <memory>
#include <string>

#include "VantorSyncManager/NubiloRemoteSession.h"
#include "localshare/ApacheShare.h"
#include "support/FakeTime.h"
#include "support/LogCapture.h"
#include "support/TestHome.h"
#include "support/TraceCapture.h"

namespace vtc::test {

using local::ApacheShare;

class ShareTest : public ::testing::Test {
 protected:
  TestHome home;
  LogCapture logged;
  FakeTime time;
  TraceCapture traces;
  ApacheShare share;

  // A session of the share's member, with overrides laid over the share's
  // configuration.
  std::unique_ptr<NubiloRemoteSession> openSession(const Dictionary& overrides = {}) const;
  // The overrides that make a session the client guid.
  static Dictionary clientOverrides(const std::string& guid);
};

}  // namespace vtc::test
