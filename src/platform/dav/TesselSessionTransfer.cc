// GET and PUT.
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <ne_basic.h>
#include <ne_dates.h>
#include <ne_locks.h>

#include <cstdio>

#include "common/Limits.h"
#include "platform/dav/DavConnection.h"
#include "platform/dav/DavPaths.h"
#include "platform/dav/TesselSession.h"

namespace {

struct BodySink {
  vtc::Bytes* memory = nullptr;
  int fd = -1;
  bool failed = false;
};

int acceptBody(void* userdata, const char* buf, size_t len) {
  auto* sink = static_cast<BodySink*>(userdata);
  if (sink->memory) {
    sink->memory->insert(sink->memory->end(), buf, buf + len);
    return 0;
  }
  while (len > 0) {
    ssize_t n = ::write(sink->fd, buf, len);
    if (n <= 0) {
      sink->failed = true;
      return -1;
    }
    buf += n;
    len -= static_cast<size_t>(n);
  }
  return 0;
}

}  // namespace

DavTransaction TesselSession::getDataAtPath(const std::string& path,
                                            std::optional<vtc::Date> ifModifiedSince,
                                            int64_t rangeStart, int64_t rangeEnd,
                                            const std::optional<std::string>& localDestination) {
  std::string escaped = vtc::davpath::escape(path);
  vtc::Bytes body;
  BodySink sink;
  if (localDestination) {
    sink.fd = ::open(localDestination->c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
    if (sink.fd < 0) {
      DavTransaction t("GET", path);
      t.setOutcome(false, 107, vtc::kNoHTTPStatus, 0);
      t.setErrorText("cannot write " + *localDestination);
      return t;
    }
    // A file takes what a changelog may be; memory what any answer may.
    connection_->allowNextAnswer(vtc::limits().changelogBytes, vtc::Limits::kChangelogKey);
  } else {
    sink.memory = &body;
  }
  DavTransaction t = connection_->perform("GET", path, [&] {
    ne_request* req = ne_request_create(connection_->session(), "GET", escaped.c_str());
    if (ifModifiedSince) {
      char* date = ne_rfc1123_date(std::chrono::system_clock::to_time_t(*ifModifiedSince));
      ne_add_request_header(req, "If-Modified-Since", date);
      ne_free(date);
    }
    if (!(rangeStart == 0 && rangeEnd == 0))
      ne_print_request_header(req, "Range", "bytes=%lld-%lld", static_cast<long long>(rangeStart),
                              static_cast<long long>(rangeEnd));
    ne_add_response_body_reader(req, ne_accept_2xx, acceptBody, &sink);
    int ret = ne_request_dispatch(req);
    const int code = ne_get_status(req)->code;
    if (ret == NE_OK && ne_get_status(req)->klass != 2 && code != 304) ret = NE_ERROR;
    if (sink.failed) ret = NE_ERROR;
    ne_request_destroy(req);
    return ret;
  });
  if (sink.fd >= 0) ::close(sink.fd);
  // A failed download leaves nothing behind: a part of an answer is no file.
  if (!t.isSuccessful() && localDestination) ::unlink(localDestination->c_str());
  if (t.isSuccessful() && !localDestination) t.setResult(vtc::Value(std::move(body)));
  return t;
}

DavTransaction TesselSession::getDataAtPath(const std::string& path) {
  return getDataAtPath(path, std::nullopt, 0, 0, std::nullopt);
}

DavTransaction TesselSession::putData(const vtc::Bytes& data, const std::string& path) {
  std::string escaped = vtc::davpath::escape(path);
  return memberRequest("PUT", {path}, [&](bool presentParent) {
    ne_request* req = ne_request_create(connection_->session(), "PUT", escaped.c_str());
    ne_lock_using_resource(req, escaped.c_str(), 0);
    if (presentParent) ne_lock_using_parent(req, escaped.c_str());
    // neon wants a buffer even for an empty body.
    static const char kEmpty = 0;
    ne_set_request_body_buffer(
        req, data.empty() ? &kEmpty : reinterpret_cast<const char*>(data.data()), data.size());
    int ret = vtc::dispatchExpectingSuccess(req);
    ne_request_destroy(req);
    return ret;
  });
}

DavTransaction TesselSession::putLocalFileAtPath(const std::string& localPath,
                                                 const std::string& path) {
  int fd = ::open(localPath.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0) {
    DavTransaction t("PUT", path);
    t.setOutcome(false, 107, vtc::kNoHTTPStatus, 0);
    t.setErrorText("cannot read " + localPath);
    return t;
  }
  struct stat st {};
  if (::fstat(fd, &st) != 0) st.st_size = 0;
  std::string escaped = vtc::davpath::escape(path);
  DavTransaction t = memberRequest("PUT", {path}, [&](bool presentParent) {
    ne_request* req = ne_request_create(connection_->session(), "PUT", escaped.c_str());
    ne_lock_using_resource(req, escaped.c_str(), 0);
    if (presentParent) ne_lock_using_parent(req, escaped.c_str());
    // From the start of the file on every try (neon sends it again after a
    // challenge, and so may the second try here).
    ne_set_request_body_fd(req, fd, 0, st.st_size);
    int ret = vtc::dispatchExpectingSuccess(req);
    ne_request_destroy(req);
    return ret;
  });
  ::close(fd);
  return t;
}
