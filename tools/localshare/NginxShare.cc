#include "localshare/NginxShare.h"

#include <unistd.h>

#include <filesystem>
#include <sstream>
#include <stdexcept>

namespace vtc::local {

namespace {

constexpr const char* kNginx = "/usr/sbin/nginx";
constexpr const char* kDavModule = "/usr/lib/nginx/modules/ngx_http_dav_ext_module.so";

}  // namespace

NginxShare::NginxShare() : Share("vsm-nginx") {
  writeTextFile(root_ + "/htpasswd", passwordFileLine(kUser, kPassword));
  std::filesystem::create_directories(root_ + "/var/body");
  std::ostringstream c;
  c << "daemon off;\nworker_processes 1;\n"
    << "pid " << root_ << "/run/nginx.pid;\n"
    << "error_log " << root_ << "/logs/error.log warn;\n"
    << "load_module " << kDavModule << ";\n";
  if (::geteuid() == 0) c << "user www-data;\n";
  c << "events { worker_connections 64; }\n"
    << "http {\n"
    << "  log_format share '$remote_port $request_method $status $uri';\n"
    << "  access_log " << root_ << "/logs/access.log share;\n";
  for (const char* temp : {"client_body", "proxy", "fastcgi", "uwsgi", "scgi"})
    c << "  " << temp << "_temp_path " << root_ << "/var/body;\n";
  c << "  dav_ext_lock_zone zone=locks:1m;\n"
    << "  server {\n"
    << "    listen 127.0.0.1:" << port_ << ";\n"
    << "    root " << documentRoot_ << ";\n"
    << "    add_header X-Responding-Server " << respondingServer() << " always;\n"
    << "    location / {\n"
    << "      auth_basic \"Tessel\";\n"
    << "      auth_basic_user_file " << root_ << "/htpasswd;\n"
    << "      dav_methods PUT DELETE MKCOL COPY MOVE;\n"
    << "      dav_ext_methods PROPFIND OPTIONS LOCK UNLOCK;\n"
    << "      dav_ext_lock zone=locks;\n"
    << "      client_max_body_size 0;\n"
    << "    }\n"
    << "  }\n"
    << "}\n";
  writeTextFile(root_ + "/nginx.conf", c.str());
  giveToWorkers("www-data");
  start({kNginx, "-p", root_, "-c", root_ + "/nginx.conf"}, root_ + "/logs/error.log");
}

void NginxShare::forgetLocks() {
  throw std::logic_error("NginxShare keeps its locks in memory");
}

}  // namespace vtc::local
