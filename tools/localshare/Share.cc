#include "localshare/Share.h"

#include <openssl/evp.h>
#include <pwd.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <iterator>
#include <sstream>
#include <stdexcept>
#include <thread>
#include <utility>

#include "localshare/ApacheShare.h"
#include "localshare/SabreShare.h"
#include "platform/fs/LocalPaths.h"

namespace vtc::local {

int freeLoopbackPort() {
  int port = 0;
  ::close(listenLoopback(port));
  return port;
}

void writeTextFile(const std::string& path, const std::string& text) {
  std::ofstream out(path);
  out << text;
  if (!out) throw std::runtime_error("cannot write " + path);
}

std::string Share::passwordFileLine(const std::string& user, const std::string& password) {
  unsigned char digest[EVP_MAX_MD_SIZE];
  unsigned int len = 0;
  EVP_Digest(password.data(), password.size(), digest, &len, EVP_sha1(), nullptr);
  unsigned char b64[64];
  EVP_EncodeBlock(b64, digest, static_cast<int>(len));
  return user + ":{SHA}" + reinterpret_cast<char*>(b64) + "\n";
}

Share::Share(const char* prefix, bool tls) : tls_(tls) {
  std::string tmpl = paths::join(paths::temporaryDirectory(), std::string(prefix) + "-XXXXXX");
  if (!mkdtemp(tmpl.data())) throw std::runtime_error("mkdtemp failed");
  root_ = tmpl;
  ::chmod(root_.c_str(), 0755);
  documentRoot_ = root_ + "/dav";
  for (const char* dir : {"/dav", "/var", "/logs", "/run"})
    std::filesystem::create_directories(root_ + dir);
  port_ = freeLoopbackPort();
}

Share::~Share() {
  stop();
  std::error_code ignored;
  std::filesystem::remove_all(root_, ignored);
}

void Share::start(const std::vector<std::string>& argv, const std::string& errorLog) {
  pid_ = startProcess(argv);
  bool listening = waitUntil([&] {
    if (::waitpid(pid_, nullptr, WNOHANG) == pid_) pid_ = -1;  // it gave up
    int fd = pid_ < 0 ? -1 : connectLoopback(port_);
    if (fd >= 0) ::close(fd);
    return pid_ < 0 || fd >= 0;
  });
  if (pid_ < 0 || !listening) {
    stop();
    std::ifstream log(errorLog);
    throw std::runtime_error(std::string(name()) + " did not start: " +
                             std::string(std::istreambuf_iterator<char>(log), {}));
  }
}

// Started as root, the servers' workers run as another user: hand them
// their folders.
void Share::giveToWorkers(const char* user) const {
  const passwd* pw = ::geteuid() == 0 ? getpwnam(user) : nullptr;
  if (!pw) return;
  for (auto& entry : std::filesystem::recursive_directory_iterator(root_))
    (void)::chown(entry.path().c_str(), pw->pw_uid, pw->pw_gid);
  (void)::chown(root_.c_str(), pw->pw_uid, pw->pw_gid);
}

std::set<std::string> Share::members(const std::string& serverPath) const {
  std::set<std::string> names;
  for (const auto& entry : std::filesystem::directory_iterator(diskPath(serverPath))) {
    const std::string name = entry.path().filename().string();
    if (!ownFile(name)) names.insert(name + (entry.is_directory() ? "/" : ""));
  }
  return names;
}

std::string Share::url(const std::string& sharePath) const {
  return std::string(tls_ ? "https" : "http") + "://127.0.0.1:" + std::to_string(port_) +
         shareRoot_ + sharePath;
}

std::vector<std::string> Share::setupArguments() const {
  if (tls_) return {"--ca-file", caFile()};
  return {"--allow-insecure"};
}

Dictionary Share::configuration() const {
  Dictionary c{
      {"host_scheme", Value(tls_ ? "https" : "http")},
      {"host_name", Value("127.0.0.1")},
      {"host_port", Value(port_)},
      {"sync_path", Value(kSyncPath)},
      {"sync_namespace", Value("http://nubilo.example/ns/sync/")},
      {"sync_dav_timeout_seconds", Value(5)},
      {"lock_duration_seconds", Value(240)},
      {"max_lock_acquire_attempts", Value(3)},
      {"lock_acquire_sleep_seconds", Value(4)},
      {"user_agent", Value("VantorClient/-/-/488")},
      {"Name", Value(kUser)},
      {"guid", Value("11111111-2222-3333-4444-555555555555")},
      {"ClientGuid", Value("11111111-2222-3333-4444-555555555555")},
      {"ClientName", Value("Test Machine")},
  };
  if (!shareRoot_.empty()) c.set("share_root", Value(shareRoot_));
  // Plain HTTP on loopback: the password crosses no network.
  if (!tls_) c.set("allow_insecure", Value(true));
  return c;
}

std::vector<AccessEntry> Share::accessEntries() const {
  // The server logs a request just after answering it: wait until the log
  // stops growing (a few milliseconds) before reading it.
  std::string path = root_ + "/logs/access.log";
  std::error_code ignored;
  uintmax_t size = std::filesystem::file_size(path, ignored), before = -1;
  for (int i = 0; i < 10 && size != before; ++i) {
    std::this_thread::sleep_for(std::chrono::milliseconds(15));
    before = std::exchange(size, std::filesystem::file_size(path, ignored));
  }
  std::vector<AccessEntry> out;
  std::ifstream in(path);
  // A line a request: client port, method, status and the path, which may
  // hold blanks ("54321 PUT 201 /sync/a b.clog").
  for (std::string line; std::getline(in, line);) {
    std::istringstream fields(line);
    AccessEntry e;
    if (!(fields >> e.clientPort >> e.method >> e.status)) continue;
    std::getline(fields >> std::ws, e.path);
    if (!shareRoot_.empty() && e.path.starts_with(shareRoot_))
      e.path = e.path.substr(shareRoot_.size());
    out.push_back(e);
  }
  return out;
}

std::unique_ptr<Share> startShare(ShareKind kind) {
  switch (kind) {
    case ShareKind::Apache:
      break;
    case ShareKind::Sabre:
      return std::make_unique<SabreShare>();
    case ShareKind::GuideApache:
      return std::make_unique<ApacheShare>(ApacheShare::Options{.site = ApacheShare::Site::Guide});
    case ShareKind::GuideApacheAlias:
      return std::make_unique<ApacheShare>(
          ApacheShare::Options{.site = ApacheShare::Site::GuideAlias});
    case ShareKind::SabreUnderPath:
      return std::make_unique<SabreShare>(SabreShare::Options{.basePath = kHostedBasePath});
  }
  return std::make_unique<ApacheShare>();
}

const char* shareKindName(ShareKind kind) {
  switch (kind) {
    case ShareKind::Apache:
      break;
    case ShareKind::Sabre:
      return "SabreDAV";
    case ShareKind::GuideApache:
      return "DebianApache";
    case ShareKind::GuideApacheAlias:
      return "DebianApacheAlias";
    case ShareKind::SabreUnderPath:
      return "SabreDAVUnderAPath";
  }
  return "Apache";
}

}  // namespace vtc::local
