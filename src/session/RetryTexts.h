// The texts and rules that set one retrying wrapper apart from the others.
#pragma once

namespace vtc {

struct RetryTexts {
  const char* timeoutLine;     // Warning on a time-out
  const char* notFoundLine;    // Warning on a 404 before the pause (gets only), or nullptr
  const char* networkLine;     // Warning on a network failure
  const char* traceMessage;    // message of the trace reports
  const char* reason;          // reason of NubiloNetworkFailureException, "%@" = transaction
  bool logsTransaction;        // Info "Transaction: %@" on any failure
  double notFoundPause;        // seconds before the 404 retry (gets only)
  bool reportsExistingTarget;  // the non-overwriting move's 412 line
};

}  // namespace vtc
