#include "localshare/ApacheShare.h"

#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <sstream>
#include <stdexcept>
#include <vector>

namespace vtc::local {

namespace {

constexpr const char* kApache = "/usr/sbin/apache2";
constexpr const char* kModules = "/usr/lib/apache2/modules";

}  // namespace

ApacheShare::ApacheShare(Options options) : Share("vsm-dav", options.tls) {
  writeConfiguration();
  giveToWorkers("www-data");
  startApache();
}

void ApacheShare::startApache() {
  start({kApache, "-f", root_ + "/httpd.conf", "-DFOREGROUND"}, root_ + "/logs/error.log");
}

void ApacheShare::writeConfiguration() {
  writeTextFile(root_ + "/htpasswd", passwordFileLine(kUser, kPassword));
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
  if (tls_) modules.insert(modules.end(), {"socache_shmcb", "ssl"});
  for (const char* m : modules)
    c << "LoadModule " << m << "_module " << kModules << "/mod_" << m << ".so\n";
  if (tls_) {
    makeCertificate(/*withAuthority=*/true);
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
    << "Header always set X-Responding-Server \"" << respondingServer() << "\"\n"
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
  writeTextFile(root_ + "/httpd.conf", c.str());
}

// A certificate for 127.0.0.1 signed by the share's private authority (made
// first when asked).
void ApacheShare::makeCertificate(bool withAuthority) {
  std::string dir = root_ + "/tls";
  std::filesystem::create_directories(dir);
  std::string commands =
      "openssl req -newkey rsa:2048 -nodes -subj '/CN=127.0.0.1' -keyout server.key "
      "-out server.csr && printf 'subjectAltName=IP:127.0.0.1\\n' > ext.cnf && "
      "openssl x509 -req -in server.csr -CA ca.pem -CAkey ca.key -CAcreateserial -days 2 "
      "-extfile ext.cnf -out server.pem";
  if (withAuthority)
    commands =
        "openssl req -x509 -newkey rsa:2048 -nodes -days 2 -subj '/CN=Share Test Authority' "
        "-keyout ca.key -out ca.pem && " +
        commands;
  if (std::system(("exec >/dev/null 2>&1 && cd '" + dir + "' && " + commands).c_str()) != 0)
    throw std::runtime_error("could not make test certificates");
}

void ApacheShare::renewCertificate() {
  if (!tls_) throw std::logic_error("renewCertificate: the share does not serve HTTPS");
  makeCertificate(/*withAuthority=*/false);
  giveToWorkers("www-data");
  // Stopped and started again on the same port: once it listens, it shows
  // the new certificate.
  stop();
  startApache();
}

void ApacheShare::forgetLocks() {
  for (const auto& entry : std::filesystem::directory_iterator(root_ + "/var"))
    if (entry.path().filename().string().starts_with("DavLock"))
      std::filesystem::remove(entry.path());
}

}  // namespace vtc::local
