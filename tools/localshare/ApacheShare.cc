#include "localshare/ApacheShare.h"

#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <regex>
#include <set>
#include <sstream>
#include <stdexcept>
#include <vector>

namespace vtc::local {

namespace {

constexpr const char* kApache = "/usr/sbin/apache2";
constexpr const char* kDebianConfiguration = "/etc/apache2";
// What Debian's apache2 package enables when it is installed.
const std::vector<std::string> kDebianModules = {
    "access_compat", "alias",      "auth_basic",  "authn_core", "authn_file", "authz_core",
    "authz_host",    "authz_user", "autoindex",   "deflate",    "dir",        "env",
    "filter",        "mime",       "negotiation", "reqtimeout", "setenvif",   "status"};
const std::vector<std::string> kDebianConfs = {
    "charset", "localized-error-pages", "other-vhosts-access-log", "security", "serve-cgi-bin"};

std::string readTextFile(const std::string& path) {
  std::ifstream in(path);
  if (!in) throw std::runtime_error("cannot read " + path);
  return std::string(std::istreambuf_iterator<char>(in), {});
}

// Replaces every occurrence of from; raises when there is none, so that a
// guide that changes its example values is noticed here, not by a share
// that quietly serves something else.
void replaceAll(std::string& text, const std::string& from, const std::string& to) {
  size_t at = text.find(from);
  if (at == std::string::npos)
    throw std::runtime_error(ApacheShare::guideSiteFile() + " no longer holds \"" + from +
                             "\", which its test replaces");
  for (; at != std::string::npos; at = text.find(from, at + to.size()))
    text.replace(at, from.size(), to);
}

}  // namespace

std::string ApacheShare::guideSiteFile() {
  return VSM_SOURCE_DIR "/docs/apache-site.conf";
}

ApacheShare::ApacheShare(Options options)
    : Share("vsm-dav", options.tls || options.site != Site::Fixture) {
  serverRoot_ = root_ + "/apache2";
  if (options.site == Site::GuideAlias) shareRoot_ = "/dav";
  writeTextFile(root_ + "/htpasswd", passwordFileLine(kUser, kPassword));
  if (tls_) makeCertificate(/*withAuthority=*/true);
  writeServerRoot(options.site);
  giveToWorkers("www-data");
  startApache();
}

void ApacheShare::startApache() {
  // Debian's envvars, pointed into the share's folder.
  start({"env", "APACHE_RUN_USER=www-data", "APACHE_RUN_GROUP=www-data",
         "APACHE_PID_FILE=" + root_ + "/run/apache2.pid", "APACHE_RUN_DIR=" + root_ + "/run",
         "APACHE_LOCK_DIR=" + root_ + "/var", "APACHE_LOG_DIR=" + root_ + "/logs", "LANG=C",
         kApache, "-d", serverRoot_, "-DFOREGROUND"},
        root_ + "/logs/error.log");
}

void ApacheShare::writeServerRoot(Site site) {
  namespace fs = std::filesystem;
  for (const char* dir : {"mods-enabled", "conf-enabled", "sites-enabled"})
    fs::create_directories(serverRoot_ + "/" + dir);
  fs::copy_file(std::string(kDebianConfiguration) + "/apache2.conf", serverRoot_ + "/apache2.conf");
  writeTextFile(serverRoot_ + "/ports.conf", "Listen 127.0.0.1:" + std::to_string(port_) + "\n");

  std::vector<std::string> modules = kDebianModules;
  std::string siteText;
  if (site == Site::Fixture) {
    // Processes, not threads: the lock database of mod_dav_fs is guarded by
    // record locks, which the threads of one process do not hold against
    // each other, so a threaded server grants two exclusive locks at once
    // far more often. The library copes either way; tests of contention
    // want the server's own exclusion in place.
    modules.insert(modules.end(), {"mpm_prefork", "dav", "dav_fs", "dav_lock"});
    if (tls_) modules.push_back("ssl");
    siteText = fixtureSite();
  } else {
    modules.push_back("mpm_event");
    siteText = guideSite(site == Site::Guide, modules);
  }
  modules.push_back("headers");  // the tests' own X-Responding-Server
  for (const std::string& module : modules) enableModule(module);
  for (const std::string& conf : kDebianConfs)
    fs::create_symlink(std::string(kDebianConfiguration) + "/conf-available/" + conf + ".conf",
                       serverRoot_ + "/conf-enabled/" + conf + ".conf");
  // What the tests read: the client port, method, status and path of each
  // request, and which server answered.
  writeTextFile(serverRoot_ + "/conf-enabled/zz-share-test.conf",
                "LogFormat \"%{remote}p %m %>s %U\" share\n"
                "CustomLog ${APACHE_LOG_DIR}/access.log share\n"
                "Header always set X-Responding-Server \"" +
                    std::string(respondingServer()) + "\"\n");
  writeTextFile(serverRoot_ + "/sites-enabled/share.conf", siteText);
}

// a2enmod's work: the module's .load and .conf, and the modules it depends
// on first.
void ApacheShare::enableModule(const std::string& module) const {
  namespace fs = std::filesystem;
  const std::string available = std::string(kDebianConfiguration) + "/mods-available/" + module;
  const std::string enabled = serverRoot_ + "/mods-enabled/" + module;
  if (fs::exists(fs::symlink_status(enabled + ".load"))) return;
  const std::string load = readTextFile(available + ".load");
  fs::create_symlink(available + ".load", enabled + ".load");
  if (fs::exists(available + ".conf")) fs::create_symlink(available + ".conf", enabled + ".conf");
  static const std::regex depends(R"(# Depends:([^\n]*))");
  std::smatch m;
  if (std::regex_search(load, m, depends)) {
    std::istringstream names(m[1].str());
    for (std::string name; names >> name;) enableModule(name);
  }
}

std::string ApacheShare::fixtureSite() const {
  std::ostringstream c;
  c << "ServerName 127.0.0.1\n";
  if (tls_)
    c << "SSLEngine on\n"
      << "SSLCertificateFile " << root_ << "/tls/server.pem\n"
      << "SSLCertificateKeyFile " << root_ << "/tls/server.key\n";
  c << "StartServers 4\nMinSpareServers 2\nMaxSpareServers 8\nServerLimit 24\n"
    << "MaxRequestWorkers 24\n"
    << "KeepAlive On\nMaxKeepAliveRequests 0\nKeepAliveTimeout 60\nTimeout 30\n"
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
  return c.str();
}

std::string ApacheShare::guideSite(bool atRoot, std::vector<std::string>& modules) const {
  std::string site = readTextFile(guideSiteFile());
  static const std::regex enable(R"(a2enmod ([a-z_ ]+))");
  std::smatch m;
  if (!std::regex_search(site, m, enable))
    throw std::runtime_error(guideSiteFile() + " no longer says which modules to enable");
  std::istringstream names(m[1].str());
  for (std::string name; names >> name;) modules.push_back(name);
  // The two ways the guide offers: under an alias, as the file stands, or
  // the whole site.
  if (atRoot) replaceAll(site, "\n    Alias /dav /srv/dav\n", "\n    DocumentRoot /srv/dav\n");
  replaceAll(site, "*:443", "*:" + std::to_string(port_));
  replaceAll(site, "/srv/dav", documentRoot_);
  replaceAll(site, "/etc/apache2/dav.passwd", root_ + "/htpasswd");
  replaceAll(site, "/etc/letsencrypt/live/dav.example.org/fullchain.pem",
             root_ + "/tls/server.pem");
  replaceAll(site, "/etc/letsencrypt/live/dav.example.org/privkey.pem", root_ + "/tls/server.key");
  return site;
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
  // Debian's dav_fs.conf keeps the lock database at
  // ${APACHE_LOCK_DIR}/DAVLock; the mutexes beside it stay.
  for (const auto& entry : std::filesystem::directory_iterator(root_ + "/var"))
    if (entry.path().filename().string().starts_with("DAVLock"))
      std::filesystem::remove(entry.path());
}

}  // namespace vtc::local
