#include "VantorSyncManager/DavTransaction.h"

#include "common/Format.h"
#include "common/ResultCodes.h"

std::string DavTransaction::description() const {
  std::string out = vtc::format("<DavTransaction %@ %@: %@, result %@, HTTP %d, state %d",
                                method_.value_or("-"), path_, successful_ ? "succeeded" : "failed",
                                vtc::resultCodeName(errorType_), httpStatus_, state_);
  if (!errorText_.empty()) out += ", \"" + errorText_ + "\"";
  return out + ">";
}
