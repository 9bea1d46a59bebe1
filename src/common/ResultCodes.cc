#include "common/ResultCodes.h"

namespace vtc {

std::string resultCodeName(int32_t code) {
  switch (code) {
    case 1:
      return "kNBSuccess";
    case 100:
      return "kNBUnknownError";
    case 101:
      return "kNBInvalidCredentials";
    case 102:
      return "kNBInsufficientStorage";
    case 103:
      return "kNBNetworkError";
    case 104:
      return "kNBResourceNotFound";
    case 105:
      return "kNBResourceExists";
    case 106:
      return "kNBTimeoutError";
    case 107:
      return "kNBInvalidParameter";
    case 108:
      return "kNBServerError";
    case 109:
      return "kNBInvalidProxyCredentials";
    case 110:
      return "kNBInternalFailure";
    case 150:
      return "kNBMultipartError";
    case 151:
      return "kNBServiceBusy";
    case 152:
      return "kNBTooManyRedirectsError";
    case 153:
      return "kNBDAVResourceError";
    default:
      return std::to_string(code);
  }
}

}  // namespace vtc
