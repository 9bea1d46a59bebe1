// A private Apache httpd WebDAV share for one test (or the demo): its own
// configuration under a temporary folder, one Basic-auth user, a lock
// database, keep-alive, an access log that records the client port, and an
// X-Responding-Server header on every answer. Started in the foreground on a
// free 127.0.0.1 port, stopped by its PID.
#pragma once

#include <sys/types.h>

#include <string>
#include <vector>

#include "VantorSyncManager/Value.h"
#include "localshare/Processes.h"

namespace vtc::local {

struct AccessEntry {
  int clientPort = 0;
  std::string method;
  int status = 0;
};

class ApacheShare {
 public:
  struct Options {
    // Serve HTTPS with a certificate from a private authority; caFile()
    // then names that authority's certificate.
    bool tls = false;
  };

  ApacheShare() : ApacheShare(Options{}) {}
  explicit ApacheShare(Options options);
  ~ApacheShare();
  ApacheShare(const ApacheShare&) = delete;
  ApacheShare& operator=(const ApacheShare&) = delete;

  int port() const { return port_; }
  pid_t pid() const { return pid_; }
  // The folder on disk that the share serves.
  const std::string& documentRoot() const { return documentRoot_; }
  // The disk path of a server path.
  std::string diskPath(const std::string& serverPath) const { return documentRoot_ + serverPath; }

  // The certificate of the authority that signed a TLS share's certificate.
  std::string caFile() const { return root_ + "/tls/ca.pem"; }

  // A session configuration for this share (the keys a session reads).
  Dictionary configuration() const;

  // The requests the server has logged so far (Apache writes its access log
  // as each request finishes).
  std::vector<AccessEntry> accessEntries() const;

  // Stops the server (by PID) before the end of the test: later requests
  // find nothing listening.
  void stop() { stopProcess(pid_); }
  // Makes the server forget every lock it holds, as a lock that timed out.
  void forgetLocks();

  static constexpr const char* kUser = "alice";
  static constexpr const char* kPassword = "wonderland";
  static constexpr const char* kSyncPath = "/Library/Application Support/SyncWorks";

 private:
  void writeConfiguration();
  void makeCertificates();

  Options options_;
  std::string root_;
  std::string documentRoot_;
  int port_ = 0;
  pid_t pid_ = -1;
};

// A TCP port on 127.0.0.1 that nothing listens on right now.
int freeLoopbackPort();

}  // namespace vtc::local
