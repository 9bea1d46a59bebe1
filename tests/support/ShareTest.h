// The common ground of the session tests: a temporary home, its log read
// back (at Info), fake time, captured message traces and a private share,
// and sessions opened on it. A fixture runs on Apache unless its cases are
// TEST_P cases of OnEachServer<Fixture>, instantiated with kEachServer.
#pragma once

#include <gtest/gtest.h>

#include <memory>
#include <ostream>
#include <string>

#include "VantorSyncManager/NubiloRemoteSession.h"
#include "localshare/Share.h"
#include "support/FakeTime.h"
#include "support/LogCapture.h"
#include "support/TestHome.h"
#include "support/TraceCapture.h"

namespace vtc::local {
// Names the server in a failing parameterised test's message.
inline void PrintTo(ShareKind kind, std::ostream* os) {
  *os << shareKindName(kind);
}
}  // namespace vtc::local

namespace vtc::test {

using local::Share;
using local::ShareKind;

class ShareTest : public ::testing::Test {
 protected:
  explicit ShareTest(ShareKind kind = ShareKind::Apache);

  TestHome home;
  LogCapture logged;
  FakeTime time;
  TraceCapture traces;

 private:
  std::unique_ptr<Share> server_;

 protected:
  Share& share;

  bool onApache() const { return kind_ == ShareKind::Apache; }
  // A session of the share's member, with overrides laid over the share's
  // configuration.
  std::unique_ptr<NubiloRemoteSession> openSession(const Dictionary& overrides = {}) const;
  // The overrides that make a session the client guid.
  static Dictionary clientOverrides(const std::string& guid);

 private:
  ShareKind kind_;
};

// A fixture whose TEST_P cases run once on each server.
template <class Fixture>
class OnEachServer : public ::testing::WithParamInterface<ShareKind>, public Fixture {
 public:
  OnEachServer() : Fixture(this->GetParam()) {}
};

inline const auto kEachServer = ::testing::Values(ShareKind::Apache, ShareKind::Sabre);
// "Apache", "SabreDAV": the last part of a parameterised test's name.
std::string serverName(const ::testing::TestParamInfo<ShareKind>& info);

}  // namespace vtc::test
