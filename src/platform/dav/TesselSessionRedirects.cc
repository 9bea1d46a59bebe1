// Collections named without their trailing "/": the one redirect a session
// follows.
#include <ne_uri.h>
#include <strings.h>

#include "platform/dav/DavConnection.h"
#include "platform/dav/DavPaths.h"
#include "platform/dav/TesselSession.h"

namespace {

bool isRedirect(int status) {
  return status == 301 || status == 302 || status == 307 || status == 308;
}

// Whether location names path with a "/" added, on the connection's own
// server: anywhere else, the credentials would follow the request.
bool addsOnlyTheSlash(const std::string& location, const std::string& path,
                      const vtc::DavEndpoint& endpoint) {
  ne_uri uri{};
  if (ne_uri_parse(location.c_str(), &uri) != 0) {
    ne_uri_free(&uri);
    return false;
  }
  bool sameServer = true;
  if (uri.host) {
    const std::string scheme = uri.scheme ? uri.scheme : endpoint.scheme;
    const unsigned port = uri.port ? uri.port : ne_uri_defaultport(scheme.c_str());
    sameServer = scheme == endpoint.scheme && ::strcasecmp(uri.host, endpoint.host.c_str()) == 0 &&
                 port == static_cast<unsigned>(endpoint.port);
  }
  ne_uri_free(&uri);
  return sameServer && !path.ends_with('/') &&
         vtc::davpath::fromHref(location) == vtc::davpath::collection(path);
}

}  // namespace

DavTransaction TesselSession::atCollectionPath(
    const std::string& path, const std::function<DavTransaction(const std::string&)>& send) {
  const std::string canonical = vtc::davpath::canonical(path);
  if (!path.ends_with('/') && slashedPaths_.count(canonical))
    return send(vtc::davpath::collection(path));
  DavTransaction t = send(path);
  if (!isRedirect(t.httpStatusCode()) || !t._responseHeaders()) return t;
  const vtc::Value* location = t._responseHeaders()->find("Location");
  if (!location || !addsOnlyTheSlash(location->string(), path, connection_->endpoint())) return t;
  slashedPaths_.insert(canonical);
  return send(vtc::davpath::collection(path));
}
