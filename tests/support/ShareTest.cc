#include "support/ShareTest.h"

namespace vtc::test {

std::unique_ptr<NubiloRemoteSession> ShareTest::openSession(const Dictionary& overrides) const {
  Dictionary config = share.configuration();
  config.merge(overrides);
  return NubiloRemoteSession::sessionWithUsername(ApacheShare::kUser, ApacheShare::kPassword,
                                                  config);
}

Dictionary ShareTest::clientOverrides(const std::string& guid) {
  return Dictionary{{"guid", guid}, {"ClientGuid", guid}};
}

}  // namespace vtc::test
