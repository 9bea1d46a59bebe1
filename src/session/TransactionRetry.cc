// Requests with retry: one immediate retry on a time-out, one delayed retry
// on a missing file for downloads, no retry for anything else.
#include "VantorSyncManager/NubiloException.h"
#include "VantorSyncManager/NubiloRemoteSession.h"
#include "VantorSyncManager/PublicNames.h"
#include "common/Clock.h"
#include "common/Logging.h"
#include "platform/dav/TesselSession.h"
#include "session/RetryTexts.h"

namespace {

constexpr vtc::RetryTexts kPropFind{"PropFind transaction failed due to timeout, retrying...",
                                    nullptr,
                                    "PropFind transaction failed due to network error raising...",
                                    "Failed to get properties",
                                    "PropFind transaction failed due to network error, %@",
                                    true,
                                    0,
                                    false};
constexpr vtc::RetryTexts kPropPatch{"PropPatch transaction failed due to timeout, retrying...",
                                     nullptr,
                                     "PropPatch transaction failed due to network error raising...",
                                     "Failed to patch properties",
                                     "PropPatch transaction failed due to network error, %@",
                                     true,
                                     0,
                                     false};
constexpr vtc::RetryTexts kGetLong{
    "getData transaction failed due to timeout, retrying...",
    "getData transaction failed due to 404 file not found at path %@, retrying...",
    "getData transaction failed due to network error raising...",
    "Failed to get data",
    "GetData transaction failed due to network error, %@",
    true,
    2,
    false};
constexpr vtc::RetryTexts kGetPath{
    "getData transaction failed due to timeout, retrying...",
    "getData transaction failed due to 404 file not found at path %@, retrying...",
    "getData transaction failed due to network error raising...",
    "Failed to get data",
    "getData transaction failed due to network error, %@",
    true,
    30,
    false};
constexpr vtc::RetryTexts kPut{"putData transaction failed due to timeout, retrying...",
                               nullptr,
                               "putData transaction failed due to network error raising...",
                               "Failed to put data",
                               "putData transaction failed due to network error, %@",
                               true,
                               0,
                               false};
constexpr vtc::RetryTexts kMove{"moveResource transaction failed due to timeout, retrying...",
                                nullptr,
                                "moveResource transaction failed due to network error raising...",
                                "Failed to move resource",
                                "moveResource transaction failed due to network error, %@",
                                false,
                                0,
                                false};
constexpr vtc::RetryTexts kMoveNoOverwrite{kMove.timeoutLine,
                                           nullptr,
                                           kMove.networkLine,
                                           kMove.traceMessage,
                                           kMove.reason,
                                           false,
                                           0,
                                           true};

}  // namespace

DavTransaction NubiloRemoteSession::retrying(const vtc::RetryTexts& texts,
                                             const std::string& subject,
                                             const std::function<DavTransaction()>& issue) {
  DavTransaction t = issue();
  if (t.isSuccessful()) return t;
  if (texts.logsTransaction) VTC_LOG_INFO("Transaction: %@", t);

  if (t.errorType() == kNBTimeoutError) {
    VTC_LOG_WARNING("%@", texts.timeoutLine);
    messageTraceTransactionFailure(t, false, 0, texts.traceMessage);
    return issue();  // returned as it is, even a second time-out or a network failure
  }
  if (texts.notFoundLine && t.httpStatusCode() == 404) {
    VTC_LOG_WARNING(texts.notFoundLine, subject);
    messageTraceTransactionFailure(t, false, 0, texts.traceMessage);
    vtc::currentSleeper().sleepFor(vtc::Seconds(texts.notFoundPause));
    DavTransaction again = issue();
    if (!again.isSuccessful()) messageTraceTransactionFailure(again, true, 1, texts.traceMessage);
    return again;
  }
  if (t.errorType() == kNBNetworkError) {
    VTC_LOG_WARNING("%@", texts.networkLine);
    messageTraceTransactionFailure(t, true, 0, texts.traceMessage);
    throw NubiloException(NubiloNetworkFailureException, vtc::format(texts.reason, t));
  }
  if (texts.reportsExistingTarget && t.httpStatusCode() == 412) {
    VTC_LOG_WARNING("moveResorce transaction failed, resource already exists at destination %@",
                    subject);
  }
  return t;
}

DavTransaction NubiloRemoteSession::_issuePropFindWithRetryAtPath(
    const std::string& path, int32_t depth, const std::vector<std::string>& props,
    bool includingParent) {
  return retrying(kPropFind, path, [&] {
    return _TesselSession->_issuePropFindAtPath(path, depth, props, includingParent);
  });
}

DavTransaction NubiloRemoteSession::_issuePropFindWithRetryAtPath(
    const std::string& path, int32_t depth, const std::vector<std::string>& props) {
  return retrying(kPropFind, path,
                  [&] { return _TesselSession->_issuePropFindAtPath(path, depth, props); });
}

DavTransaction NubiloRemoteSession::_issuePropPatchWithRetryAtPath(const std::string& path,
                                                                   const vtc::Dictionary& props,
                                                                   const std::string& nameSpace) {
  return retrying(kPropPatch, path,
                  [&] { return _TesselSession->_issuePropPatchAtPath(path, props, nameSpace); });
}

DavTransaction NubiloRemoteSession::getDataWithRetryAtPath(
    const std::string& path, std::optional<vtc::Date> ifModifiedSince, int64_t rangeStart,
    int64_t rangeEnd, const std::optional<std::string>& localDestination) {
  return retrying(kGetLong, path, [&] {
    return _TesselSession->getDataAtPath(path, ifModifiedSince, rangeStart, rangeEnd,
                                         localDestination);
  });
}

DavTransaction NubiloRemoteSession::getDataWithRetryAtPath(const std::string& path) {
  return retrying(kGetPath, path, [&] { return _TesselSession->getDataAtPath(path); });
}

DavTransaction NubiloRemoteSession::getDataWithRetryAtPath(const std::string& path,
                                                           const std::string& localDestination) {
  return retrying(kGetPath, path, [&] {
    return _TesselSession->getDataAtPath(path, std::nullopt, 0, 0, localDestination);
  });
}

DavTransaction NubiloRemoteSession::putDataWithRetry(const vtc::Bytes& data,
                                                     const std::string& path) {
  return retrying(kPut, path, [&] { return _TesselSession->putData(data, path); });
}

DavTransaction NubiloRemoteSession::moveResourceWithRetryAtPath(const std::string& source,
                                                                const std::string& destination,
                                                                bool allowingOverwrite) {
  return retrying(kMoveNoOverwrite, destination, [&] {
    return _TesselSession->moveResourceAtPath(source, destination, allowingOverwrite);
  });
}

DavTransaction NubiloRemoteSession::moveResourceWithRetryAtPath(const std::string& source,
                                                                const std::string& destination) {
  return retrying(kMove, destination,
                  [&] { return _TesselSession->moveResourceAtPath(source, destination); });
}
