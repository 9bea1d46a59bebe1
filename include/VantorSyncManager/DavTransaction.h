// The outcome of one WebDAV request: success, result code, HTTP status,
// completion state, parsed result, response headers and method.
#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "VantorSyncManager/Export.h"
#include "VantorSyncManager/Value.h"

namespace vtc {
// transactionState of a request that got an HTTP answer.
inline constexpr int32_t kTransactionCompleted = 3;
// transactionState of a request that got no answer (refused, reset, timed out).
inline constexpr int32_t kTransactionNoAnswer = 2;
// httpStatusCode when there was no answer.
inline constexpr int32_t kNoHTTPStatus = -1;
}  // namespace vtc

class VSM_EXPORT DavTransaction {
 public:
  DavTransaction() = default;
  DavTransaction(std::string method, std::string path)
      : method_(std::move(method)), path_(std::move(path)) {}

  bool isSuccessful() const { return successful_; }
  int32_t errorType() const { return errorType_; }
  int32_t httpStatusCode() const { return httpStatus_; }
  int32_t transactionState() const { return state_; }
  const vtc::Value& result() const { return result_; }
  // Hands the parsed result over without a copy (a downloaded body can be large).
  vtc::Value takeResult() { return std::move(result_); }
  const std::optional<vtc::Dictionary>& _responseHeaders() const { return headers_; }
  // The request's method; none for a transaction that stands for no request.
  const std::optional<std::string>& method() const { return method_; }
  const std::string& path() const { return path_; }
  // neon's or the system's own words for a failure, empty on success.
  const std::string& errorText() const { return errorText_; }

  std::string description() const;

  void setOutcome(bool successful, int32_t errorType, int32_t httpStatus, int32_t state) {
    successful_ = successful;
    errorType_ = errorType;
    httpStatus_ = httpStatus;
    state_ = state;
  }
  void setResult(vtc::Value result) { result_ = std::move(result); }
  void setResponseHeaders(std::optional<vtc::Dictionary> headers) { headers_ = std::move(headers); }
  void setErrorText(std::string text) { errorText_ = std::move(text); }

 private:
  bool successful_ = false;
  int32_t errorType_ = 100;
  int32_t httpStatus_ = vtc::kNoHTTPStatus;
  int32_t state_ = 0;
  vtc::Value result_;
  std::optional<vtc::Dictionary> headers_;
  std::optional<std::string> method_;
  std::string path_;
  std::string errorText_;
};
