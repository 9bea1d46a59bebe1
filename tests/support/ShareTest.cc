#include "support/ShareTest.h"

namespace vtc::test {

ShareTest::ShareTest(ShareKind kind)
    : server_(local::startShare(kind)), share(*server_), kind_(kind) {}

std::unique_ptr<NubiloRemoteSession> ShareTest::openSession(const Dictionary& overrides) const {
  Dictionary config = share.configuration();
  config.merge(overrides);
  return NubiloRemoteSession::sessionWithUsername(Share::kUser, Share::kPassword, config);
}

Dictionary ShareTest::clientOverrides(const std::string& guid) {
  return Dictionary{{"guid", guid}, {"ClientGuid", guid}};
}

std::string serverName(const ::testing::TestParamInfo<ShareKind>& info) {
  return local::shareKindName(info.param);
}

}  // namespace vtc::test
