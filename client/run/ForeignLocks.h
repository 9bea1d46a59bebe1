// Locks on the share that another computer left: found by the client id in
// their owner record, given back with their token.
#pragma once

#include <cstddef>
#include <string>

class NubiloRemoteSession;

namespace vtc::client {

// Gives back every lock on path whose owner names clientId; returns how
// many were given back.
size_t releaseLocksOf(NubiloRemoteSession& session, const std::string& path,
                      const std::string& clientId);

}  // namespace vtc::client
