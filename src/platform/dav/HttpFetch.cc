#include "platform/dav/HttpFetch.h"

#include <ne_request.h>
#include <ne_session.h>
#include <ne_uri.h>

#include "common/Format.h"
#include "common/Limits.h"
#include "platform/dav/RequestDeadline.h"

namespace vtc {

namespace {

struct Sink {
  Bytes body;
  uint64_t most;
  bool over = false;
};

int appendBody(void* userdata, const char* buf, size_t len) {
  auto* sink = static_cast<Sink*>(userdata);
  if (sink->body.size() + len > sink->most) {
    sink->over = true;
    return -1;
  }
  sink->body.insert(sink->body.end(), buf, buf + len);
  return 0;
}

}  // namespace

std::optional<Bytes> fetchURL(const std::string& url, std::string* error, uint64_t maxBytes,
                              const char* limitKey, int timeoutSeconds) {
  ne_uri uri{};
  if (ne_uri_parse(url.c_str(), &uri) != 0 || !uri.host || !uri.scheme) {
    ne_uri_free(&uri);
    if (error) *error = "not a URL: " + url;
    return std::nullopt;
  }
  if (uri.port == 0) uri.port = ne_uri_defaultport(uri.scheme);
  std::string target = uri.path ? uri.path : "/";
  if (uri.query) target += std::string("?") + uri.query;

  ne_session* session = ne_session_create(uri.scheme, uri.host, uri.port);
  if (std::string(uri.scheme) == "https") ne_ssl_trust_default_ca(session);
  ne_set_read_timeout(session, timeoutSeconds);
  ne_set_connect_timeout(session, timeoutSeconds);
  ne_request* req = ne_request_create(session, "GET", target.c_str());
  Sink sink{{}, maxBytes};
  ne_add_response_body_reader(req, ne_accept_2xx, appendBody, &sink);
  int ret = NE_ERROR;
  bool late;
  {
    RequestDeadline deadline(session);
    late = deadline.run(
        timeoutSeconds, [&] { return ne_request_dispatch(req); }, ret);
  }
  const ne_status* status = ne_get_status(req);
  std::optional<Bytes> out;
  if (ret == NE_OK && status->klass == 2 && !late) {
    out = std::move(sink.body);
  } else if (error) {
    if (late)
      *error = format("no complete answer within %d seconds", timeoutSeconds);
    else if (sink.over)
      *error = overLimitText("The answer from " + url, maxBytes, limitKey);
    else
      *error = ret == NE_OK ? format("%d %@", status->code, status->reason_phrase)
                            : std::string(ne_get_error(session));
  }
  ne_request_destroy(req);
  ne_session_destroy(session);
  ne_uri_free(&uri);
  return out;
}

}  // namespace vtc
