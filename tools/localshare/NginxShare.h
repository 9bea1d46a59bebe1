// nginx with its WebDAV modules (the Debian packages): files, collections,
// moves and locks, but no PROPPATCH. A share the sync client must refuse.
#pragma once

#include "localshare/Share.h"

namespace vtc::local {

class NginxShare : public Share {
 public:
  NginxShare();

  const char* name() const override { return "nginx"; }
  const char* respondingServer() const override { return "dav-test-3"; }
  // Its locks live in the server's memory: only a restart forgets them.
  void forgetLocks() override;
};

}  // namespace vtc::local
