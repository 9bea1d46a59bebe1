#include "platform/dav/HttpFetch.h"

#include <ne_request.h>
#include <ne_session.h>
#include <ne_uri.h>

#include "common/Format.h"

namespace vtc {

namespace {

int appendBody(void* userdata, const char* buf, size_t len) {
  auto* body = static_cast<Bytes*>(userdata);
  body->insert(body->end(), buf, buf + len);
  return 0;
}

}  // namespace

std::optional<Bytes> fetchURL(const std::string& url, std::string* error, int timeoutSeconds) {
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
  Bytes body;
  ne_add_response_body_reader(req, ne_accept_2xx, appendBody, &body);
  int ret = ne_request_dispatch(req);
  const ne_status* status = ne_get_status(req);
  std::optional<Bytes> out;
  if (ret == NE_OK && status->klass == 2) {
    out = std::move(body);
  } else if (error) {
    *error = ret == NE_OK ? format("%d %@", status->code, status->reason_phrase)
                          : std::string(ne_get_error(session));
  }
  ne_request_destroy(req);
  ne_session_destroy(session);
  ne_uri_free(&uri);
  return out;
}

}  // namespace vtc
