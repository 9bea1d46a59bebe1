// SMDataclassInfo: no longer functional; every member reports so.
#include "VantorSyncManager/LegacySession.h"
#include "common/Assertions.h"

namespace {

constexpr const char* kNoLongerFunctional =
    "SMDataclassInfo is no longer functional and should not be used";

}  // namespace

SMDataclassInfo::SMDataclassInfo(const std::string&, const std::string&) {
  VTC_ASSERTION_FAILURE("SMDataclassInfo", "SMDataclassInfo", kNoLongerFunctional);
}

int64_t SMDataclassInfo::maxVersion() const {
  VTC_ASSERTION_FAILURE("SMDataclassInfo", "maxVersion", kNoLongerFunctional);
  return 0;
}

void SMDataclassInfo::setName(const std::string&) {
  VTC_ASSERTION_FAILURE("SMDataclassInfo", "setName", kNoLongerFunctional);
}

int32_t SMDataclassInfo::syncMode() const {
  VTC_ASSERTION_FAILURE("SMDataclassInfo", "syncMode", kNoLongerFunctional);
  return -1;
}

std::optional<vtc::Date> SMDataclassInfo::lastSyncDate() const {
  VTC_ASSERTION_FAILURE("SMDataclassInfo", "lastSyncDate", kNoLongerFunctional);
  return std::nullopt;
}
