#include "platform/dav/DavPaths.h"

#include <ne_alloc.h>
#include <ne_uri.h>

namespace vtc::davpath {

namespace {

std::string takeNeonString(char* s) {
  std::string out = s ? s : "";
  ne_free(s);
  return out;
}

}  // namespace

std::string escape(std::string_view path) {
  return takeNeonString(ne_path_escape(std::string(path).c_str()));
}

std::string fromHref(std::string_view href) {
  std::string h(href);
  ne_uri uri{};
  std::string path = h;
  if (ne_uri_parse(h.c_str(), &uri) == 0 && uri.path) path = uri.path;
  ne_uri_free(&uri);
  char* unescaped = ne_path_unescape(path.c_str());
  return unescaped ? takeNeonString(unescaped) : path;
}

std::string canonical(std::string_view path) {
  std::string p(path);
  while (p.size() > 1 && p.back() == '/') p.pop_back();
  return p;
}

std::string collection(std::string_view path) {
  std::string p = canonical(path);
  return p.ends_with('/') ? p : p + '/';
}

std::string parent(std::string_view path) {
  std::string p = canonical(path);
  size_t slash = p.find_last_of('/');
  if (slash == std::string::npos || slash == 0) return "/";
  return p.substr(0, slash + 1);
}

std::string lastComponent(std::string_view path) {
  std::string p = canonical(path);
  size_t slash = p.find_last_of('/');
  return slash == std::string::npos ? p : p.substr(slash + 1);
}

}  // namespace vtc::davpath
