// Locks on the share that another computer left: found by the client id in
// their owner record, given back with their token. A run renews the locks it
// holds at least every fifth of their duration (LockRenewal.h); a lock left
// unrenewed for more than three fifths of it belongs to a run that stopped
// (a computer that crashed or lost its network), and is taken over.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>

#include "VantorSyncManager/Value.h"

class NubiloRemoteSession;

namespace vtc::client {

// Gives back every lock on path whose owner names clientId; returns how
// many were given back.
size_t releaseLocksOf(NubiloRemoteSession& session, const std::string& path,
                      const std::string& clientId);

// Whether a lock, as the share's lock discovery tells it, was left
// unrenewed for longer than a run that holds it ever lets it be.
bool abandonedLock(const Dictionary& lock, int64_t lockDuration);

// "Took over the lock of com.korvo.Contacts that Mac A left ...".
std::string takeoverSentence(const std::string& what, const Dictionary& lock);

}  // namespace vtc::client
