#include "platform/fs/LocalPaths.h"

#include <pwd.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <mutex>
#include <vector>

namespace vtc::paths {

namespace {

std::string envOr(const char* name, std::string_view fallback) {
  const char* v = std::getenv(name);
  return (v && *v) ? std::string(v) : std::string(fallback);
}

}  // namespace

std::string homeDirectory() {
  if (const char* h = std::getenv("HOME"); h && *h) return h;
  if (const passwd* pw = getpwuid(getuid()); pw && pw->pw_dir) return pw->pw_dir;
  return "/";
}

std::string expandTilde(std::string_view path) {
  if (path == "~") return homeDirectory();
  if (path.starts_with("~/")) return join(homeDirectory(), path.substr(2));
  return std::string(path);
}

std::string join(std::string_view a, std::string_view b) {
  if (a.empty()) return std::string(b);
  if (b.empty()) return std::string(a);
  std::string out(a);
  if (out.back() == '/' && b.front() == '/')
    out.pop_back();
  else if (out.back() != '/' && b.front() != '/')
    out += '/';
  out.append(b);
  return out;
}

std::string cachesDirectory() {
  return envOr("XDG_CACHE_HOME", join(homeDirectory(), ".cache"));
}

std::string applicationSupportDirectory() {
  return envOr("XDG_DATA_HOME", join(homeDirectory(), ".local/share"));
}

std::string configDirectory() {
  return envOr("XDG_CONFIG_HOME", join(homeDirectory(), ".config"));
}

std::string temporaryDirectory() {
  return envOr("TMPDIR", "/tmp");
}

bool makeDirectories(const std::string& path, int mode) {
  if (path.empty()) return false;
  struct stat st {};
  if (::stat(path.c_str(), &st) == 0) return S_ISDIR(st.st_mode);
  size_t slash = path.find_last_of('/');
  if (slash != std::string::npos && slash > 0) {
    if (!makeDirectories(path.substr(0, slash), mode)) return false;
  }
  if (::mkdir(path.c_str(), static_cast<mode_t>(mode)) == 0) return true;
  return errno == EEXIST && ::stat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
}

std::optional<std::string> supportFolder() {
  // Kept per home: tests change homes within a process.
  static std::mutex mutex;
  static std::optional<std::string> cached;
  static std::string cachedBase;
  std::lock_guard<std::mutex> lock(mutex);
  std::string base = applicationSupportDirectory();
  if (cached && base == cachedBase) return cached;
  cachedBase = base;
  cached.reset();
  if (base.empty()) return std::nullopt;
  std::string path = join(base, "NubiloSyncClient");
  struct stat st {};
  if (::stat(path.c_str(), &st) == 0) {
    if (S_ISDIR(st.st_mode)) return cached = path;
    if (::unlink(path.c_str()) != 0) return std::nullopt;
  }
  if (!makeDirectories(path, 0700)) {
    std::fprintf(stderr, "createDirectoryAtPath:%s failed %s\n", path.c_str(),
                 std::strerror(errno));
    return std::nullopt;
  }
  return cached = path;
}

}  // namespace vtc::paths
