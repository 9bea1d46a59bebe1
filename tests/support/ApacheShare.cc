#include "support/ApacheShare.h"

#include "support/Processes.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <openssl/evp.h>
#include <pwd.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <stdexcept>
#include <thread>
#include <vector>

namespace vtc::test {

const char* const ApacheShare::kSyncPath = "/Library/Application Support/SyncWorks";
const char* const ApacheShare::kSyncNamespace = "http://nubilo.example/ns/sync/";

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

bool canConnect(int port) {
  int fd = ::socket(AF_INET, SOCK_STREAM, 0);
  sockaddr_in addr{};
  addr.sin_family = AF_INET;
  addr.sin_port = htons(static_cast<uint16_t>(port));
  addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  bool ok = ::connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) == 0;
  ::close(fd);
  return ok;
}

// Started as root, Apache's workers run as www-data: hand them their folders.
void giveToWorkers(const std::string& path) {
  if (::geteuid() != 0) return;
  if (const passwd* pw = getpwnam("www-data")) {
    for (auto& entry : std::filesystem::recursive_directory_iterator(path))
      (void)::chown(entry.path().c_str(), pw->pw_uid, pw->pw_gid);
    (void)::chown(path.c_str(), pw->pw_uid, pw->pw_gid);
  }
}

}  // namespace

int freeLoopbackPort() {
  int fd = ::socket(AF_INET, SOCK_STREAM, 0);
  sockaddr_in addr{};
  addr.sin_family = AF_INET;
  addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  addr.sin_port = 0;
  ::bind(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr);
  socklen_t len = sizeof addr;
  ::getsockname(fd, reinterpret_cast<sockaddr*>(&addr), &len);
  int port = ntohs(addr.sin_port);
  ::close(fd);
  return port;
}

ApacheShare::ApacheShare() : ApacheShare(Options{}) {}

ApacheShare::ApacheShare(Options options) : options_(std::move(options)) {
  char tmpl[] = "/tmp/vsm-dav-XXXXXX";
  if (!mkdtemp(tmpl)) throw std::runtime_error("mkdtemp failed");
  root_ = tmpl;
  ::chmod(root_.c_str(), 0755);
  documentRoot_ = root_ + "/dav";
  for (const char* dir : {"/dav", "/var", "/logs", "/run"})
    std::filesystem::create_directories(root_ + dir);
  writeConfiguration();
  giveToWorkers(documentRoot_);
  giveToWorkers(root_ + "/var");
  start();
}

ApacheShare::~ApacheShare() {
  stop();
  std::error_code ignored;
  std::filesystem::remove_all(root_, ignored);
}

void ApacheShare::writeConfiguration() {
  port_ = freeLoopbackPort();
  writeFile(root_ + "/htpasswd", shaPasswordLine(options_.user, options_.password));
  std::ostringstream c;
  c << "ServerRoot " << root_ << "\n"
    << "ServerName 127.0.0.1\n"
    << "Listen 127.0.0.1:" << port_ << "\n"
    << "PidFile " << root_ << "/run/httpd.pid\n"
    << "DefaultRuntimeDir " << root_ << "/run\n"
    << "ErrorLog " << root_ << "/logs/error.log\n"
    << "LogLevel warn\n";
  std::vector<const char*> modules = {"mpm_event",  "authn_core", "authn_file", "authz_core",
                                      "authz_user", "auth_basic", "dav",        "dav_fs",
                                      "dav_lock",   "headers"};
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
  c << "StartServers 1\nServerLimit 1\nThreadsPerChild 16\nMaxRequestWorkers 16\n"
    << "KeepAlive On\nMaxKeepAliveRequests 0\nKeepAliveTimeout 60\nTimeout 30\n"
    << "LogFormat \"%a %{remote}p %m \\\"%U\\\" %>s\" share\n"
    << "CustomLog " << root_ << "/logs/access.log share\n"
    << "Header always set X-Responding-Server \"" << options_.respondingServer << "\"\n"
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
  std::string script =
      "cd '" + dir +
      "' && "
      "openssl req -x509 -newkey rsa:2048 -nodes -days 2 -subj '/CN=Share Test Authority' "
      "-keyout ca.key -out ca.pem && "
      "openssl req -newkey rsa:2048 -nodes -subj '/CN=127.0.0.1' -keyout server.key "
      "-out server.csr && "
      "printf 'subjectAltName=IP:127.0.0.1\\n' > ext.cnf && "
      "openssl x509 -req -in server.csr -CA ca.pem -CAkey ca.key -CAcreateserial -days 2 "
      "-extfile ext.cnf -out server.pem";
  if (std::system((script + " >/dev/null 2>&1").c_str()) != 0)
    throw std::runtime_error("could not make test certificates");
}

void ApacheShare::start() {
  std::string conf = root_ + "/httpd.conf";
  pid_ = ::fork();
  if (pid_ == 0) {
    // A test process that dies without its destructors takes the server along.
    ::prctl(PR_SET_PDEATHSIG, SIGTERM);
    int devnull = ::open("/dev/null", O_RDWR);
    ::dup2(devnull, 0);
    ::dup2(devnull, 1);
    ::dup2(devnull, 2);
    ::execl(kApache, kApache, "-f", conf.c_str(), "-DFOREGROUND", static_cast<char*>(nullptr));
    ::_exit(127);
  }
  // Ready when the port answers; give up after ten seconds.
  for (int i = 0; i < 1000; ++i) {
    if (canConnect(port_)) return;
    int status = 0;
    if (::waitpid(pid_, &status, WNOHANG) == pid_) {
      pid_ = -1;
      std::ifstream log(root_ + "/logs/error.log");
      std::stringstream text;
      text << log.rdbuf();
      throw std::runtime_error("apache2 exited at start: " + text.str());
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  stop();
  throw std::runtime_error("apache2 did not start listening");
}

void ApacheShare::stop() {
  stopProcess(pid_);
}

void ApacheShare::forgetLocks() {
  for (const auto& entry : std::filesystem::directory_iterator(root_ + "/var"))
    if (entry.path().filename().string().starts_with("DavLock"))
      std::filesystem::remove(entry.path());
}

std::string ApacheShare::diskPath(const std::string& serverPath) const {
  return documentRoot_ + serverPath;
}

Dictionary ApacheShare::configuration() const {
  return Dictionary{
      {"host_scheme", Value(options_.tls ? "https" : "http")},
      {"host_name", Value("127.0.0.1")},
      {"host_port", Value(port_)},
      {"sync_path", Value(kSyncPath)},
      {"sync_namespace", Value(kSyncNamespace)},
      {"sync_dav_timeout_seconds", Value(5)},
      {"lock_duration_seconds", Value(240)},
      {"max_lock_acquire_attempts", Value(3)},
      {"lock_acquire_sleep_seconds", Value(4)},
      {"user_agent", Value("VantorClient/-/-/488")},
      {"Name", Value(options_.user)},
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
  uintmax_t size = std::filesystem::file_size(path, ignored);
  for (int i = 0; i < 10; ++i) {
    std::this_thread::sleep_for(std::chrono::milliseconds(15));
    uintmax_t now = std::filesystem::file_size(path, ignored);
    if (now == size) break;
    size = now;
  }
  std::vector<AccessEntry> out;
  std::ifstream in(path);
  for (std::string line; std::getline(in, line);) {
    // 127.0.0.1 54321 PROPFIND "/path with spaces" 207
    AccessEntry e;
    std::istringstream s(line);
    std::string address;
    s >> address >> e.clientPort >> e.method;
    size_t open = line.find('"'), close = line.rfind('"');
    if (open == std::string::npos || close <= open) continue;
    e.path = line.substr(open + 1, close - open - 1);
    e.status = std::atoi(line.c_str() + close + 1);
    out.push_back(e);
  }
  return out;
}

}  // namespace vtc::test
