// What an encrypted account's key does to the bytes the share holds:
// changelogs (inside their envelope), reports, and short texts such as a
// computer's name. Everything is XChaCha20-Poly1305 (a changelog as a
// secretstream of 64 KiB pieces, so memory follows one piece) with
// associated data naming what the bytes are and where they belong, so bytes
// moved from one place to another fail authentication like bytes changed.
// Thread-safe: a seal does not change once made.
#pragma once

#include <cstdint>
#include <iosfwd>
#include <optional>
#include <string>

#include "VantorSyncManager/Value.h"
#include "platform/sealing/SecretKey.h"

namespace vtc::sealing {

// The value of the envelope's "BodyEncryption" header.
inline constexpr const char* kChangeLogEncryption = "xchacha20poly1305-ietf/1";
// How a sealed text begins.
inline constexpr const char* kSealedTextPrefix = "sealed:";
// The purposes of what the session seals besides changelogs.
inline constexpr const char* kClientNamePurpose = "client name";
inline constexpr const char* kTruthDigestPurpose = "truth digest";
inline constexpr const char* kReportPurpose = "report";
inline constexpr const char* kSharedConflictsPurpose = "shared conflicts";

class AccountSeal {
 public:
  explicit AccountSeal(SecretKey key);

  // Writes to out what the share holds for the changelog (the ordinary
  // format, size bytes read from changelog) at index of dataclass: an
  // envelope whose headers are envelopeHeaders (nothing personal) around
  // the sealed changelog. Raises std::runtime_error when a stream fails.
  void sealChangeLog(std::istream& changelog, uint64_t size, std::ostream& out,
                     const std::string& dataclass, int64_t index,
                     const Dictionary& envelopeHeaders) const;
  // Writes the changelog inside stored (a seekable stream) to out. Raises
  // std::runtime_error with the reason when stored is no envelope of this
  // account's or fails authentication; out then holds a part of it at most,
  // which the caller throws away.
  void openChangeLog(std::istream& stored, std::ostream& out, const std::string& dataclass,
                     int64_t index) const;
  // The same in memory.
  Bytes sealChangeLog(ByteView changelog, const std::string& dataclass, int64_t index,
                      const Dictionary& envelopeHeaders) const;
  Bytes openChangeLog(ByteView stored, const std::string& dataclass, int64_t index) const;

  // Any bytes, for one purpose ("report", say): nonce and ciphertext.
  Bytes seal(ByteView plain, const std::string& purpose) const;
  // nullopt when the bytes fail authentication for that purpose.
  std::optional<Bytes> open(ByteView sealed, const std::string& purpose) const;

  // A short text as a sealed text ("sealed:" and base64). The nonce comes
  // from the text itself, so equal texts seal alike (a name kept on the
  // share does not change with every session).
  std::string sealText(const std::string& text, const std::string& purpose) const;
  // The text inside; nullopt for a text that is not sealed or not this
  // account's.
  std::optional<std::string> openText(const std::string& sealed, const std::string& purpose) const;

 private:
  Bytes encrypt(ByteView plain, const std::string& associated, ByteView nonce) const;
  SecretKey key_;
  SecretKey nonceKey_;  // derived: the nonces of sealed texts
};

bool isSealedText(const std::string& text);

}  // namespace vtc::sealing
