// What syncing needs of a share beyond a login, tried on the share itself
// at setup: dead properties that come back, locks that keep other clients
// out, a lock owner that others can read, and a move that refuses to
// overwrite. A share that lacks one is refused with a sentence naming it.
#pragma once

#include <functional>
#include <memory>
#include <string>

class NubiloRemoteSession;

namespace vtc::client {

// Tries each need with probe resources in the sync area, which it removes
// again; `other` opens a second session of the account (a client of its
// own, with its own locks). Raises SyncFailure (ServerUnsuitable) naming
// the first need the server at url does not meet.
void qualifyServer(NubiloRemoteSession& session,
                   const std::function<std::unique_ptr<NubiloRemoteSession>()>& other,
                   const std::string& url);

}  // namespace vtc::client
