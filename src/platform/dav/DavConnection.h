// One neon session to one server: credentials, TLS (ServerCertificate.h),
// time-outs, the lock store, and the capture of each request's status and
// headers. Every request of a session travels over its one persistent
// connection. Not thread-safe: callers serialise (TesselSession's monitor).
#pragma once

#include <cstdint>
#include <functional>
#include <optional>
#include <string>

#include <ne_locks.h>
#include <ne_request.h>
#include <ne_session.h>

#include "VantorSyncManager/DavTransaction.h"
#include "VantorSyncManager/Value.h"
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

  // Read and connect time-out in seconds (neon's resolution). neon applies it
  // when it connects, so a change closes an open connection.
  void setReadTimeout(int seconds);

  // Runs `run`, which issues one logical request through session() (neon
  // may send it more than once for authentication) and returns neon's result
  // code, and maps the outcome onto a transaction: result code, HTTP status of
  // the final answer, completion state and response headers.
  DavTransaction perform(const std::string& method, const std::string& path,
                         const std::function<int()>& run);

 private:
  struct Capture {
    int status = kNoHTTPStatus;
    std::optional<Dictionary> headers;
  };
  static void onCreateRequest(ne_request* req, void* userdata, const char* method,
                              const char* requri);
  static int onPostSend(ne_request* req, void* userdata, const ne_status* status);
  static int onAuthenticate(void* userdata, const char* realm, int attempt, char* username,
                            char* password);
  static int onVerify(void* userdata, int failures, const ne_ssl_certificate* cert);

  DavEndpoint endpoint_;
  std::string user_;
  std::string password_;
  ne_session* session_ = nullptr;
  ne_lock_store* locks_ = nullptr;
  Capture capture_;
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
