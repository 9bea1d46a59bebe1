#include "platform/dav/DavConnection.h"

#include <ne_auth.h>
#include <ne_string.h>
#include <ne_utils.h>

#include <cctype>
#include <cstring>

#include "common/Format.h"
#include "common/Limits.h"
#include "common/Logging.h"
#include "platform/network/PlainConnection.h"

namespace vtc {

namespace {

// "x-responding-server" -> "X-Responding-Server"
std::string canonicalHeaderName(const char* name) {
  std::string out = name ? name : "";
  bool upper = true;
  for (char& c : out) {
    c = upper ? static_cast<char>(std::toupper(static_cast<unsigned char>(c)))
              : static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
    upper = (c == '-');
  }
  return out;
}

}  // namespace

DavConnection::DavConnection(DavEndpoint endpoint, std::string user, std::string password,
                             std::string userAgent, int readTimeout, CertificateTrust trust)
    : endpoint_(std::move(endpoint)),
      user_(std::move(user)),
      password_(std::move(password)),
      trust_(std::move(trust)) {
  static const bool initialised = (ne_sock_init(), true);
  (void)initialised;
  session_ = ne_session_create(endpoint_.scheme.c_str(), endpoint_.host.c_str(),
                               static_cast<unsigned>(endpoint_.port));
  // Our hooks go first, so that they see every answer, including a 401 that
  // the authentication hook then turns into a retry or a failure.
  ne_hook_create_request(session_, onCreateRequest, this);
  ne_hook_post_send(session_, onPostSend, this);
  // Basic is offered over plain HTTP too: the user chose the scheme.
  ne_add_server_auth(session_, NE_AUTH_BASIC | NE_AUTH_DIGEST, onAuthenticate, this);
  // neon is given no authority: every certificate comes to onVerify, which
  // judges it and notes its digest.
  if (endpoint_.scheme == "https") ne_ssl_set_verify(session_, onVerify, this);
  if (!userAgent.empty()) ne_set_useragent(session_, userAgent.c_str());
  locks_ = ne_lockstore_create();
  ne_lockstore_register(locks_, session_);
  deadline_ = std::make_unique<RequestDeadline>(session_);
  setReadTimeout(readTimeout);
}

DavConnection::~DavConnection() {
  deadline_.reset();
  if (session_) ne_session_destroy(session_);
  if (locks_) ne_lockstore_destroy(locks_);
  wipe(password_);
}

void DavConnection::setReadTimeout(int seconds) {
  if (seconds <= 0 || seconds == readTimeout_) return;
  readTimeout_ = seconds;
  ne_set_read_timeout(session_, seconds);
  ne_set_connect_timeout(session_, seconds);
  if (used_) ne_close_connection(session_);
}

void DavConnection::allowNextAnswer(uint64_t bytes, const char* key) {
  nextAnswer_.emplace(bytes, key);
}

DavTransaction DavConnection::perform(const std::string& method, const std::string& path,
                                      const std::function<int()>& run) {
  capture_ = Capture{};
  used_ = true;
  std::tie(answerCap_, answerKey_) =
      nextAnswer_.value_or(std::pair(limits().answerBytes, Limits::kAnswerKey));
  nextAnswer_.reset();
  int result = NE_ERROR;
  const bool late = deadline_->run(readTimeout_, run, result);
  DavTransaction t(method, path);
  if (late) {
    t.setOutcome(false, 106, kNoHTTPStatus, kTransactionNoAnswer);
    t.setErrorText(format("no complete answer within %d seconds", readTimeout_));
    return t;
  }
  applyOutcome(t, result, capture_.status, method);
  if (capture_.status != kNoHTTPStatus) t.setResponseHeaders(capture_.headers);
  if (capture_.overCap) {
    t.setOutcome(false, 153, capture_.status, kTransactionCompleted);
    t.setErrorText(
        overLimitText(format("The answer to %@ %@", method, path), answerCap_, answerKey_));
  } else if (!t.isSuccessful()) {
    const char* error = ne_get_error(session_);
    t.setErrorText(error ? error : "");
  }
  return t;
}

void DavConnection::onCreateRequest(ne_request* req, void* userdata, const char*, const char*) {
  auto* self = static_cast<DavConnection*>(userdata);
  self->capture_ = Capture{};
  // Every answer is counted, error pages too, before any reader keeps it.
  ne_add_response_body_reader(req, &DavConnection::acceptBody, &DavConnection::countBody, self);
}

int DavConnection::acceptBody(void* userdata, ne_request* req, const ne_status* status) {
  auto* self = static_cast<DavConnection*>(userdata);
  // Noted here too: a body given up before its end leaves no later hook.
  self->capture_.status = status ? status->code : kNoHTTPStatus;
  // A length announced beyond the cap is refused at the body's first bytes.
  if (const char* length = ne_get_response_header(req, "Content-Length"))
    self->capture_.bodyBytes =
        std::strtoull(length, nullptr, 10) > self->answerCap_ ? self->answerCap_ : 0;
  return 1;
}

int DavConnection::countBody(void* userdata, const char*, size_t len) {
  auto* self = static_cast<DavConnection*>(userdata);
  if (len == 0) return 0;  // the end of the body
  self->capture_.bodyBytes += len;
  if (self->capture_.bodyBytes <= self->answerCap_) return 0;
  self->capture_.overCap = true;
  ne_set_error(self->session_, "%s", "answer over its size limit");
  return -1;
}

int DavConnection::onPostSend(ne_request* req, void* userdata, const ne_status* status) {
  auto* self = static_cast<DavConnection*>(userdata);
  self->capture_.status = status ? status->code : kNoHTTPStatus;
  Dictionary headers;
  void* cursor = nullptr;
  const char* name = nullptr;
  const char* value = nullptr;
  while ((cursor = ne_response_header_iterate(req, cursor, &name, &value)) != nullptr) {
    headers.set(canonicalHeaderName(name), Value(value ? value : ""));
  }
  self->capture_.headers = std::move(headers);
  return NE_OK;
}

int DavConnection::onAuthenticate(void* userdata, const char*, int attempt, char* username,
                                  char* password) {
  auto* self = static_cast<DavConnection*>(userdata);
  // One try per challenge: wrong credentials fail at once instead of looping.
  if (attempt > 0) return -1;
  if (self->endpoint_.scheme != "https")
    if (auto warning =
            network::passwordInClearWarning(self->user_, self->endpoint_.host,
                                            format("%@://%@:%d", self->endpoint_.scheme,
                                                   self->endpoint_.host, self->endpoint_.port),
                                            "HTTP"))
      VTC_LOG_WARNING("%@", *warning);
  ne_strnzcpy(username, self->user_.c_str(), NE_ABUFSIZ);
  ne_strnzcpy(password, self->password_.c_str(), NE_ABUFSIZ);
  return 0;
}

int DavConnection::onVerify(void* userdata, int failures, const ne_ssl_certificate* cert) {
  auto* self = static_cast<DavConnection*>(userdata);
  self->certificateDigest_ = vtc::certificateDigest(cert);
  self->refusal_ = judgeCertificate(self->trust_, failures, cert);
  return self->refusal_ ? -1 : 0;
}

int dispatchExpectingSuccess(ne_request* request) {
  int ret = ne_request_dispatch(request);
  if (ret == NE_OK && ne_get_status(request)->klass != 2) ret = NE_ERROR;
  return ret;
}

void applyOutcome(DavTransaction& t, int neonResult, int status, const std::string& method) {
  const bool answered = status != kNoHTTPStatus && status > 0;
  const int32_t state = answered ? kTransactionCompleted : kTransactionNoAnswer;
  const int32_t httpStatus = answered ? status : kNoHTTPStatus;

  if (neonResult == NE_TIMEOUT) return t.setOutcome(false, 106, httpStatus, kTransactionNoAnswer);
  if (neonResult == NE_CONNECT || neonResult == NE_LOOKUP)
    return t.setOutcome(false, 103, kNoHTTPStatus, kTransactionNoAnswer);
  if (!answered) return t.setOutcome(false, 103, kNoHTTPStatus, kTransactionNoAnswer);

  const bool multistatusAllowed = method == "PROPFIND" || method == "PROPPATCH";
  if (neonResult == NE_OK && status / 100 == 2 && (status != 207 || multistatusAllowed))
    return t.setOutcome(true, 1, status, state);
  if (neonResult == NE_OK && status == 304) return t.setOutcome(true, 1, status, state);

  int32_t code;
  switch (status) {
    case 207:
      code = 150;
      break;  // a multistatus answer that reports failures
    case 400:
      code = 107;
      break;
    case 401:
      code = 101;
      break;
    case 404:
      code = 104;
      break;
    case 405:
      code = 105;
      break;  // MKCOL of an existing collection
    case 407:
      code = 109;
      break;
    case 409:
      code = 104;
      break;  // a missing parent
    case 412:
      code = 105;
      break;  // MOVE without overwrite onto an existing target
    case 423:
    case 424:
      code = 153;
      break;
    case 503:
      code = 151;
      break;
    case 507:
      code = 102;
      break;
    default:
      if (status / 100 == 3)
        code = 152;
      else if (status / 100 == 5)
        code = 108;
      else if (status / 100 == 2)
        code = 153;  // answered 2xx, but unusable
      else
        code = 100;
  }
  if (neonResult == NE_PROXYAUTH) code = 109;
  t.setOutcome(false, code, status, state);
}

}  // namespace vtc
