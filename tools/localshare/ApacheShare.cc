#include "localshare/ApacheShare.h"

#include "platform/fs/LocalPaths.h"

#include <openssl/evp.h>
#include <pwd.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <sstream>
#include <stdexcept>
#include <thread>
#include <utility>

namespace vtc::local {

namespace {

constexpr const char* kApache = "/usr/sbin/apache2";
constexpr const char* kModules = "/usr/lib/apache2/modules";

std::string shaPasswordLine(const std::string& user, const std::string& password) {
  unsigned char digest[EVP_MAX_MD_SIZE];
  unsigned int len = 0;
  EVP_Digest(password.data(), password.size(), digest, &len, EVP_sha1(), nullptr);
  unsigned char b64[64];
  EVP_EncodeBlock(b64, digest, static_cast<int>(len));
  return user + ":{SHA}" + reinterpret_cast<char*>(b64) + "\n";
}

void writeFile(const std::string& path, const std::string& text) {
  std::ofstream out(path);
  out << text;
  if (!out) throw std::runtime_error("cannot write " + path);
}

// Started as root, Apache's workers run as www-data: hand them their folders.
void giveToWorkers(const std::string& path) {
  const passwd* pw = ::geteuid() == 0 ? getpwnam("www-data") : nullptr;
  if (!pw) return;
  for (auto& entry : std::filesystem::recursive_directory_iterator(path))
    (void)::chown(entry.path().c_str(), pw->pw_uid, pw->pw_gid);
  (void)::chown(path.c_str(), pw->pw_uid, pw->pw_gid);
}

}  // namespace

int freeLoopbackPort() {
  int port = 0;
  ::close(listenLoopback(port));
  return port;
}

ApacheShare::ApacheShare(Options options) : options_(options) {
  std::string tmpl = paths::join(paths::temporaryDirectory(), "vsm-dav-XXXXXX");
  if (!mkdtemp(tmpl.data())) throw std::runtime_error("mkdtemp failed");
  root_ = tmpl;
  ::chmod(root_.c_str(), 0755);
  documentRoot_ = root_ + "/dav";
  for (const char* dir : {"/dav", "/var", "/logs", "/run"})
    std::filesystem::create_directories(root_ + dir);
  writeConfiguration();
  giveToWorkers(root_);

  pid_ = startProcess({kApache, "-f", root_ + "/httpd.conf", "-DFOREGROUND"});
  bool listening = waitUntil([&] {
    if (::waitpid(pid_, nullptr, WNOHANG) == pid_) pid_ = -1;  // it gave up
    int fd = pid_ < 0 ? -1 : connectLoopback(port_);
    if (fd >= 0) ::close(fd);
    return pid_ < 0 || fd >= 0;
  });
  if (pid_ < 0 || !listening) {
    stop();
    std::ifstream log(root_ + "/logs/error.log");
    throw std::runtime_error("apache2 did not start: " +
                             std::string(std::istreambuf_iterator<char>(log), {}));
  }
}

ApacheShare::~ApacheShare() {
  stop();
  std::error_code ignored;
  std::filesystem::remove_all(root_, ignored);
}

void ApacheShare::writeConfiguration() {
  port_ = freeLoopbackPort();
  writeFile(root_ + "/htpasswd", shaPasswordLine(kUser, kPassword));
  std::ostringstream c;
  c << "ServerRoot " << root_ << "\n"
    << "ServerName 127.0.0.1\n"
    << "Listen 127.0.0.1:" << port_ << "\n"
    << "PidFile " << root_ << "/run/httpd.pid\n"
    << "DefaultRuntimeDir " << root_ << "/run\n"
    << "ErrorLog " << root_ << "/logs/error.log\n"
    << "LogLevel warn\n";
  std::vector<const char*> modules = {"mpm_prefork", "authn_core", "authn_file", "authz_core",
                                      "authz_user",  "auth_basic", "dav",        "dav_fs",
                                      "dav_lock",    "headers"};
  if (options_.tls) modules.insert(modules.end(), {"socache_shmcb", "ssl"});
  for (const char* m : modules)
    c << "LoadModule " << m << "_module " << kModules << "/mod_" << m << ".so\n";
  if (options_.tls) {
    makeCertificates();
    c << "SSLEngine on\n"
      << "SSLCertificateFile " << root_ << "/tls/server.pem\n"
      << "SSLCertificateKeyFile " << root_ << "/tls/server.key\n"
      << "SSLSessionCache shmcb:" << root_ << "/run/ssl_scache(512000)\n";
  }
  if (::geteuid() == 0) c << "User www-data\nGroup www-data\n";
  // Processes, not threads: the lock database of mod_dav_fs is guarded by
  // record locks, which the threads of one process do not hold against each
  // other, so a threaded server can grant two exclusive locks at once.
  c << "StartServers 4\nMinSpareServers 2\nMaxSpareServers 8\nServerLimit 24\n"
    << "MaxRequestWorkers 24\n"
    << "KeepAlive On\nMaxKeepAliveRequests 0\nKeepAliveTimeout 60\nTimeout 30\n"
    << "LogFormat \"%{remote}p %m %>s\" share\n"
    << "CustomLog " << root_ << "/logs/access.log share\n"
    << "Header always set X-Responding-Server \"dav-test-1\"\n"
    << "DavLockDB " << root_ << "/var/DavLock\n"
    << "DocumentRoot " << documentRoot_ << "\n"
    << "<Directory " << documentRoot_ << ">\n"
    << "  Dav On\n  AllowOverride None\n  Options None\n"
    << "  AuthType Basic\n  AuthName \"Tessel\"\n  AuthBasicProvider file\n"
    << "  AuthUserFile " << root_ << "/htpasswd\n  Require valid-user\n"
    << "</Directory>\n"
    // Configuration documents are public, as on a configuration server.
    << "<Directory " << documentRoot_ << "/configurations>\n"
    << "  Dav Off\n  Require all granted\n"
    << "</Directory>\n";
  writeFile(root_ + "/httpd.conf", c.str());
}

// A private authority and a certificate for 127.0.0.1 signed by it.
void ApacheShare::makeCertificates() {
  std::string dir = root_ + "/tls";
  std::filesystem::create_directories(dir);
  const char* commands =
      "openssl req -x509 -newkey rsa:2048 -nodes -days 2 -subj '/CN=Share Test Authority' "
      "-keyout ca.key -out ca.pem && "
      "openssl req -newkey rsa:2048 -nodes -subj '/CN=127.0.0.1' -keyout server.key "
      "-out server.csr && printf 'subjectAltName=IP:127.0.0.1\\n' > ext.cnf && "
      "openssl x509 -req -in server.csr -CA ca.pem -CAkey ca.key -CAcreateserial -days 2 "
      "-extfile ext.cnf -out server.pem";
  if (std::system(("exec >/dev/null 2>&1 && cd '" + dir + "' && " + commands).c_str()) != 0)
    throw std::runtime_error("could not make test certificates");
}

void ApacheShare::forgetLocks() {
  for (const auto& entry : std::filesystem::directory_iterator(root_ + "/var"))
    if (entry.path().filename().string().starts_with("DavLock"))
      std::filesystem::remove(entry.path());
}

Dictionary ApacheShare::configuration() const {
  return Dictionary{
      {"host_scheme", Value(options_.tls ? "https" : "http")},
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
}

std::vector<AccessEntry> ApacheShare::accessEntries() const {
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
  // A line a request: client port, method, status ("54321 PUT 201").
  for (AccessEntry e; in >> e.clientPort >> e.method >> e.status;) out.push_back(e);
  return out;
}

}  // namespace vtc::local
