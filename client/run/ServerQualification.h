// What syncing needs of a share beyond a login, tried on the share itself
// at setup with the very requests a sync sends: dead properties of files
// and collections that come back, collections asked for with and without
// their trailing "/", locks of files and collections that keep other
// clients out and whose owner others can read, writes under a held lock, a
// move that refuses to overwrite and a move of a collection. A share that
// lacks one is refused with a sentence naming it.
#pragma once

#include <functional>
#include <memory>
#include <string>

class NubiloRemoteSession;

namespace vtc::client {

// Tries each need with probe resources in folder (an existing collection of
// the share), which it removes again whatever it finds; `other` opens a
// second session of the account (a client of its own, with its own locks).
// Raises SyncFailure (ServerUnsuitable) naming the first need the server at
// url does not meet.
void qualifyServer(NubiloRemoteSession& session,
                   const std::function<std::unique_ptr<NubiloRemoteSession>()>& other,
                   const std::string& folder, const std::string& url);

}  // namespace vtc::client
