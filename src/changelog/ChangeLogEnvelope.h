// The envelope of an encrypted account's changelog: a changelog of the
// ordinary format with no records, whose headers say how the body is
// encrypted and whose body is the ciphertext of the whole inner changelog.
// Every reader of the format reads it as a changelog without changes; only
// the account key opens the body (platform/sealing/AccountSeal), whose
// authentication covers the envelope as well.
#pragma once

#include <optional>

#include "VantorSyncManager/Value.h"

namespace vtc::clog {

inline constexpr const char* kBodyEncryptionHeader = "BodyEncryption";

struct Envelope {
  Dictionary headers;  // as written, values as text
  ByteView body;       // the ciphertext, a view into the bytes read
};

// The envelope in bytes, or nullopt for anything else (a plain changelog,
// or bytes that are no changelog). Work and memory are bounded by the
// bytes' length.
std::optional<Envelope> readEnvelope(ByteView bytes);

// The envelope's bytes before the body: the index and these headers (one
// of them kBodyEncryptionHeader) with "CreationTimestamp" of now. The body
// follows it.
Bytes envelopeHead(Dictionary headers);

}  // namespace vtc::clog
