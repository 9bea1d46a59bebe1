#include "localshare/SabreShare.h"

#include <filesystem>
#include <sstream>

namespace vtc::local {

namespace {

// A PHP single-quoted string literal.
std::string phpString(const std::string& text) {
  std::string out = "'";
  for (char c : text) {
    if (c == '\'' || c == '\\') out += '\\';
    out += c;
  }
  return out + "'";
}

}  // namespace

SabreShare::SabreShare(Options options) : Share("vsm-sabre") {
  shareRoot_ = options.basePath;
  writeServer(options);
  // Several workers, as a real deployment answers requests side by side.
  start({"env", "PHP_CLI_SERVER_WORKERS=4", "php", "-d", "display_errors=stderr", "-d",
         "log_errors=On", "-d", "error_log=" + root_ + "/logs/error.log", "-S",
         "127.0.0.1:" + std::to_string(port_), "-t", documentRoot_, root_ + "/server.php"},
        root_ + "/logs/error.log");
}

void SabreShare::writeServer(const Options& options) {
  std::ostringstream php;
  php << "<?php\n"
      << "// Every request of the share: SabreDAV over the folder dav/.\n"
      << "error_reporting(E_ALL & ~E_DEPRECATED);\n"
      << "date_default_timezone_set('UTC');\n"
      << "require_once 'Sabre/autoload.php';\n"
      << "$root = " << phpString(root_) << ";\n"
      << "register_shutdown_function(function () use ($root) {\n"
      << "  file_put_contents($root . '/logs/access.log', $_SERVER['REMOTE_PORT'] . ' ' .\n"
      << "    $_SERVER['REQUEST_METHOD'] . ' ' . http_response_code() . ' ' .\n"
      << "    rawurldecode(parse_url($_SERVER['REQUEST_URI'], PHP_URL_PATH)) . \"\\n\",\n"
      << "    FILE_APPEND | LOCK_EX);\n"
      << "});\n"
      << "class ShareUser extends Sabre\\DAV\\Auth\\Backend\\AbstractBasic {\n"
      << "  protected function validateUserPass($user, $password) {\n"
      << "    return $user === " << phpString(kUser) << " && $password === " << phpString(kPassword)
      << ";\n"
      << "  }\n"
      << "}\n";
  if (!options.enforceLocks)
    php << "// Grants every lock and every write, locked or not.\n"
        << "class UnenforcedLocks extends Sabre\\DAV\\Locks\\Plugin {\n"
        << "  protected function validateLock($urls = null, &$lastLock = null,\n"
        << "                                  $checkChildLocks = false) { return true; }\n"
        << "}\n";
  php << "$pdo = new PDO('sqlite:' . $root . '/var/locks.sqlite');\n"
      << "$pdo->setAttribute(PDO::ATTR_ERRMODE, PDO::ERRMODE_EXCEPTION);\n"
      << "$pdo->setAttribute(PDO::ATTR_TIMEOUT, 10);\n"
      << "$pdo->exec('CREATE TABLE IF NOT EXISTS locks (id integer primary key asc, owner text, '\n"
      << "  . 'timeout integer, created integer, token text, scope integer, depth integer, '\n"
      << "  . 'uri text)');\n"
      << "$server = new Sabre\\DAV\\Server(new Sabre\\DAV\\FSExt\\Directory($root . '/dav'));\n"
      << "$server->setBaseUri(" << phpString(options.basePath + "/") << ");\n"
      << "$server->addPlugin(new Sabre\\DAV\\Auth\\Plugin(new ShareUser(), 'Tessel'));\n"
      << "$locks = new Sabre\\DAV\\Locks\\Backend\\PDO($pdo);\n"
      << "$server->addPlugin(new "
      << (options.enforceLocks ? "Sabre\\DAV\\Locks\\Plugin" : "UnenforcedLocks") << "($locks));\n"
      << "header('X-Responding-Server: " << respondingServer() << "');\n"
      << "$server->exec();\n";
  writeTextFile(root_ + "/server.php", php.str());
}

void SabreShare::forgetLocks() {
  // The server makes the table again at its next request.
  std::filesystem::remove(root_ + "/var/locks.sqlite");
}

}  // namespace vtc::local
