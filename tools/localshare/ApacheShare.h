// Apache httpd with mod_dav_fs: the reference share. A lock database,
// keep-alive, worker processes, and an X-Responding-Server header on every
// answer; HTTPS on request, with a certificate from a private authority.
#pragma once

#include <string>

#include "localshare/Share.h"

namespace vtc::local {

class ApacheShare : public Share {
 public:
  struct Options {
    // Serve HTTPS with a certificate from a private authority; caFile()
    // then names that authority's certificate.
    bool tls = false;
  };

  ApacheShare() : ApacheShare(Options{}) {}
  explicit ApacheShare(Options options);

  const char* name() const override { return "Apache"; }
  const char* respondingServer() const override { return "dav-test-1"; }
  void forgetLocks() override;

  // The certificate of the authority that signed a TLS share's certificate.
  std::string caFile() const { return root_ + "/tls/ca.pem"; }
  // Gives a TLS share a new key and certificate from the same authority and
  // restarts the server on the same port with them.
  void renewCertificate();

 protected:
  // mod_dav_fs keeps properties and state in a ".DAV" folder beside them.
  bool ownFile(const std::string& name) const override { return name == ".DAV"; }

 private:
  void startApache();
  void writeConfiguration();
  void makeCertificate(bool withAuthority);
};

}  // namespace vtc::local
