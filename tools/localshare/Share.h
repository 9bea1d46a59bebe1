// A private WebDAV share for one test (or the demo, or a benchmark): a real
// server with its own configuration under a temporary folder, one Basic-auth
// user, locks, and an access log that records the client port, method,
// status and path of each request. Started in the foreground on a free
// 127.0.0.1 port, stopped by its PID. ApacheShare and SabreShare are the two
// servers the sync runs on; NginxShare is one it refuses. A share may begin
// below the server's root (shareRoot()); the paths a Share takes and gives
// are relative to where it begins.
#pragma once

#include <sys/types.h>

#include <memory>
#include <set>
#include <string>
#include <vector>

#include "VantorSyncManager/Value.h"
#include "localshare/Processes.h"

namespace vtc::local {

struct AccessEntry {
  int clientPort = 0;
  std::string method;
  int status = 0;
  std::string path;  // the server path, unescaped
};

class Share {
 public:
  virtual ~Share();
  Share(const Share&) = delete;
  Share& operator=(const Share&) = delete;

  // "Apache", "SabreDAV", "nginx": for test names and messages.
  virtual const char* name() const = 0;
  // The X-Responding-Server header that every answer carries.
  virtual const char* respondingServer() const = 0;

  int port() const { return port_; }
  pid_t pid() const { return pid_; }
  // The folder on disk that the share serves.
  const std::string& documentRoot() const { return documentRoot_; }
  // Where the share begins on the server: "" at its root, else a path
  // ("/dav").
  const std::string& shareRoot() const { return shareRoot_; }
  // The disk path of a path of the share.
  std::string diskPath(const std::string& sharePath) const { return documentRoot_ + sharePath; }
  // The names of the members of a served folder, a folder's with a trailing
  // "/"; files the server keeps there for itself are left out.
  std::set<std::string> members(const std::string& serverPath) const;
  // The address of a path of the share ("http://127.0.0.1:PORT/dav/sync").
  std::string url(const std::string& sharePath = "") const;
  // The authority's certificate that an HTTPS share's certificate needs;
  // empty for a plain one.
  virtual std::string caFile() const { return ""; }
  // What `setup` needs besides the address to trust this share: the
  // authority of an HTTPS share, or leave to send the password over a
  // plain one.
  std::vector<std::string> setupArguments() const;

  // A session configuration for this share (the keys a session reads).
  Dictionary configuration() const;

  // The requests the server has logged so far (it writes its access log as
  // each request finishes).
  std::vector<AccessEntry> accessEntries() const;

  // Stops the server (by PID) before the end of the test: later requests
  // find nothing listening.
  void stop() { stopProcess(pid_); }
  // Makes the server forget every lock it holds, as a lock that timed out.
  virtual void forgetLocks() = 0;

  static constexpr const char* kUser = "alice";
  static constexpr const char* kPassword = "wonderland";
  static constexpr const char* kSyncPath = "/Library/Application Support/SyncWorks";

 protected:
  // Makes the temporary folder (prefix names it) with dav/, var/, logs/ and
  // run/, and picks the port.
  explicit Share(const char* prefix, bool tls = false);
  // Starts the server and waits until it listens; on failure raises with the
  // error log's text.
  void start(const std::vector<std::string>& argv, const std::string& errorLog);
  // Hands the folder to the worker user when started as root.
  void giveToWorkers(const char* user) const;
  // A Basic-auth password file line for user ("user:{SHA}...").
  static std::string passwordFileLine(const std::string& user, const std::string& password);
  // Whether a file of that name in a served folder is the server's own.
  virtual bool ownFile(const std::string&) const { return false; }

  std::string root_;
  std::string documentRoot_;
  std::string shareRoot_;
  int port_ = 0;
  pid_t pid_ = -1;
  bool tls_ = false;
};

// The servers that the sync runs on: the tests' own Apache and SabreDAV at
// the server's root; Apache as Debian ships it, set up by the guide's site
// file (docs/apache-site.conf) over HTTPS, at the site's root and under
// "Alias /dav"; SabreDAV with a base path, as hosted storage lives.
enum class ShareKind { Apache, Sabre, GuideApache, GuideApacheAlias, SabreUnderPath };
std::unique_ptr<Share> startShare(ShareKind kind);
const char* shareKindName(ShareKind kind);
// Where SabreUnderPath begins, as a hosted account's WebDAV root does.
inline constexpr const char* kHostedBasePath = "/remote/files/alice";

// A TCP port on 127.0.0.1 that nothing listens on right now.
int freeLoopbackPort();

// Writes text to path; raises when it cannot.
void writeTextFile(const std::string& path, const std::string& text);

}  // namespace vtc::local
