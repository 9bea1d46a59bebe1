// The message-trace report of a retried or failed transaction: up to three
// records tied together by one fresh UUID and the session's UUID.
#include "VantorSyncManager/Diagnostics.h"
#include "VantorSyncManager/NubiloRemoteSession.h"
#include "common/ResultCodes.h"
#include "common/Uuid.h"

void NubiloRemoteSession::messageTraceTransactionFailure(const DavTransaction& transaction,
                                                         bool finalRetry, int64_t retryCount,
                                                         const std::string& message) {
  if (!transaction.method()) return;  // a transaction that stands for no request
  const std::string& method = *transaction.method();
  const std::string code = vtc::resultCodeName(transaction.errorType());
  const int32_t http = transaction.httpStatusCode();
  const std::string httpText = http == vtc::kNoHTTPStatus ? std::string() : std::to_string(http);
  const std::string uuid = vtc::makeUUIDString();
  const std::string count = std::to_string(retryCount);

  VTCMessageTrace("com.korvo.sync.nubilosession.retrytransaction", method.c_str(), nullptr, nullptr,
                  "noop", uuid.c_str(), count.c_str(), nullptr, message.c_str(),
                  _sessionUUID.c_str());
  VTCMessageTrace("com.korvo.sync.nubilosession.retrytransaction.errorcode", code.c_str(),
                  http == vtc::kNoHTTPStatus ? nullptr : httpText.c_str(), nullptr, "noop",
                  uuid.c_str(), nullptr, nullptr, message.c_str(), _sessionUUID.c_str());
  if (finalRetry) {
    const bool ok = transaction.isSuccessful();
    VTCMessageTrace("com.korvo.sync.nubilosession.retrytransaction.final",
                    ok ? "Succeeded" : "Raised Exception", nullptr, nullptr,
                    ok ? "success" : "failure", uuid.c_str(), nullptr, nullptr, message.c_str(),
                    _sessionUUID.c_str());
  }
}
