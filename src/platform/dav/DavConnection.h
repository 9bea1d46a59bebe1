// One neon session to one server: credentials, TLS (ServerCertificate.h),
// time-outs, the lock store, and the capture of each request's status and
// headers. Every request of a session travels over its one persistent
// connection. Each request has a deadline for its whole answer (the read
// time-out) and a cap on the bytes of its answer (common/Limits.h); a
// password sent over plain HTTP to another computer is noted with a Warning
// line each time.
// Not thread-safe: callers serialise (TesselSession's monitor).
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>

#include <ne_locks.h>
#include <ne_request.h>
#include <ne_session.h>

#include "VantorSyncManager/DavTransaction.h"
#include "VantorSyncManager/Value.h"
#include "common/SecretMemory.h"
#include "platform/dav/RequestDeadline.h"
#include "platform/dav/ServerCertificate.h"

namespace vtc {

// What a connection has learnt of its server's ways from the server's
// answers; each starts as the standard behaviour.
struct ServerTraits {
  // Whether a write under a locked collection must present only the locks
  // of the resource itself, the server refusing (412) a token of the
  // parent's lock; unknown until a 412 tells.
  std::optional<bool> refusesParentTokens;
  // The lock discovery leaves out the owner that the LOCK carried.
  bool dropsLockOwners = false;
  // A lock lasts as long as the server likes, not as long as asked.
  bool ignoresLockTimeouts = false;
};

struct DavEndpoint {
  std::string scheme;
  std::string host;
  int32_t port = 0;
  bool operator==(const DavEndpoint&) const = default;
};

class DavConnection {
 public:
  // readTimeout: seconds, 0 for neon's default. trust applies to HTTPS.
  DavConnection(DavEndpoint endpoint, std::string user, std::string password, std::string userAgent,
                int readTimeout = 0, CertificateTrust trust = {});
  ~DavConnection();
  DavConnection(const DavConnection&) = delete;
  DavConnection& operator=(const DavConnection&) = delete;

  const DavEndpoint& endpoint() const { return endpoint_; }
  ne_session* session() const { return session_; }
  ne_lock_store* lockStore() const { return locks_; }
  ServerTraits& traits() { return traits_; }
  const CertificateTrust& trust() const { return trust_; }
  // The digest of the certificate the server showed last; empty before one.
  const std::string& certificateDigest() const { return certificateDigest_; }
  // Why the server's certificate was refused last; none when it was not.
  std::optional<CertificateRefusal> certificateRefusal() const { return refusal_; }

  // Read and connect time-out in seconds (neon's resolution), and the
  // deadline of each whole answer. neon applies it when it connects, so a
  // change closes an open connection.
  void setReadTimeout(int seconds);

  // The answer of the next request may be this large (else the answer cap
  // of the limits), the sentence naming key when it is larger.
  void allowNextAnswer(uint64_t bytes, const char* key);

  // Runs `run`, which issues one logical request through session() (neon
  // may send it more than once for authentication) and returns neon's result
  // code, and maps the outcome onto a transaction: result code, HTTP status of
  // the final answer, completion state and response headers. An answer that
  // did not come whole within the deadline is a time-out (106); one over its
  // cap is refused (153), with a sentence in the error text.
  DavTransaction perform(const std::string& method, const std::string& path,
                         const std::function<int()>& run);

 private:
  struct Capture {
    int status = kNoHTTPStatus;
    std::optional<Dictionary> headers;
    uint64_t bodyBytes = 0;
    bool overCap = false;
  };
  static int acceptBody(void* userdata, ne_request* req, const ne_status* status);
  static int countBody(void* userdata, const char* buf, size_t len);
  static void onCreateRequest(ne_request* req, void* userdata, const char* method,
                              const char* requri);
  static int onPostSend(ne_request* req, void* userdata, const ne_status* status);
  static int onAuthenticate(void* userdata, const char* realm, int attempt, char* username,
                            char* password);
  static int onVerify(void* userdata, int failures, const ne_ssl_certificate* cert);

  DavEndpoint endpoint_;
  std::string user_;
  std::string password_;
  SecretHold hold_;
  ne_session* session_ = nullptr;
  ne_lock_store* locks_ = nullptr;
  std::unique_ptr<RequestDeadline> deadline_;
  Capture capture_;
  uint64_t answerCap_ = 0;  // of the request under way
  const char* answerKey_ = "";
  std::optional<std::pair<uint64_t, const char*>> nextAnswer_;
  ServerTraits traits_;
  CertificateTrust trust_;
  std::string certificateDigest_;
  std::optional<CertificateRefusal> refusal_;
  int readTimeout_ = 0;
  bool used_ = false;  // a connection may be open
};

// Dispatches a request and turns a non-2xx answer into NE_ERROR. The caller
// still owns and destroys the request.
int dispatchExpectingSuccess(ne_request* request);

// Maps neon's result and the final HTTP status onto a transaction's outcome.
void applyOutcome(DavTransaction& transaction, int neonResult, int httpStatus,
                  const std::string& method);

}  // namespace vtc
