// SabreDAV (the Debian package) under PHP's built-in server: the second
// share the sync runs on. Properties live in files beside the resources
// (".sabredav"), locks in an SQLite database; each answer says which worker
// process gave it in the access log. With enforceLocks off it grants and
// lists locks but lets anyone write and lock over them: a server to refuse.
// With a base path the share begins there (its setBaseUri), as a hosted
// account's WebDAV root does; the server's root is then no share at all.
#pragma once

#include "localshare/Share.h"

namespace vtc::local {

class SabreShare : public Share {
 public:
  struct Options {
    bool enforceLocks = true;
    std::string basePath = "";  // or a path without a trailing "/"
  };

  SabreShare() : SabreShare(Options{}) {}
  explicit SabreShare(Options options);

  const char* name() const override { return "SabreDAV"; }
  const char* respondingServer() const override { return "dav-test-2"; }
  void forgetLocks() override;

  // The name of the file in each folder that holds its members' properties.
  static constexpr const char* kPropertyFile = ".sabredav";

 protected:
  bool ownFile(const std::string& name) const override { return name == kPropertyFile; }

 private:
  void writeServer(const Options& options);
};

}  // namespace vtc::local
