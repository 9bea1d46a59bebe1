// Apache httpd with mod_dav_fs: the reference share, run as Debian ships
// it. Each share is a server root of its own laid out as /etc/apache2 is:
// Debian's own apache2.conf, the modules that Debian enables by default
// (mod_dir with DirectorySlash at its default, mod_autoindex, mod_mime,
// mod_alias and the rest) with their Debian configuration, Debian's default
// conf-enabled files, then a site. The site is either the tests' own (a
// share at the root, worker processes, long keep-alive) or the guide's
// site file, docs/apache-site.conf, as a reader would install it. Every
// answer carries an X-Responding-Server header; HTTPS on request, with a
// certificate from a private authority.
#pragma once

#include <string>
#include <vector>

#include "localshare/Share.h"

namespace vtc::local {

class ApacheShare : public Share {
 public:
  enum class Site {
    Fixture,     // the tests' own site
    Guide,       // the guide's site file, the share at the site's root
    GuideAlias,  // the guide's site file as it stands: the share under /dav
  };
  struct Options {
    // Serve HTTPS with a certificate from a private authority; caFile()
    // then names that authority's certificate. The guide's site always
    // does.
    bool tls = false;
    Site site = Site::Fixture;
  };

  ApacheShare() : ApacheShare(Options{}) {}
  explicit ApacheShare(Options options);

  const char* name() const override { return "Apache"; }
  const char* respondingServer() const override { return "dav-test-1"; }
  void forgetLocks() override;

  // The certificate of the authority that signed a TLS share's certificate.
  std::string caFile() const override { return root_ + "/tls/ca.pem"; }
  // Gives a TLS share a new key and certificate from the same authority and
  // restarts the server on the same port with them.
  void renewCertificate();

  // The guide's site file (docs/apache-site.conf in the source tree).
  static std::string guideSiteFile();

 protected:
  // mod_dav_fs keeps properties and state in a ".DAV" folder beside them.
  bool ownFile(const std::string& name) const override { return name == ".DAV"; }

 private:
  void startApache();
  void writeServerRoot(Site site);
  std::string fixtureSite() const;
  // The guide's site file with its example paths and names replaced by this
  // share's; the modules its a2enmod line names go to modules.
  std::string guideSite(bool atRoot, std::vector<std::string>& modules) const;
  void enableModule(const std::string& module) const;
  void makeCertificate(bool withAuthority);

  std::string serverRoot_;
};

}  // namespace vtc::local
