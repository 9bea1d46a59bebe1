// Constants and small pieces shared by the changelog reader, writer and
// crash flags.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "VantorSyncManager/NubiloException.h"
#include "VantorSyncManager/PublicNames.h"
#include "VantorSyncManager/Value.h"

namespace vtc::clog {

inline constexpr uint32_t kFormatNumber = 101;
inline constexpr uint32_t kIndexEnd = 0xFFFFFFFF;
inline constexpr const char* kHeaderEnd = "HeaderEnd=$%__END__OF__HEADER%$";
inline constexpr const char* kClientType = "Vantor Client";

// A changelog that cannot be decoded.
[[noreturn]] inline void corrupt(const std::string& reason) {
  throw NubiloException(NubiloCorruptChangelogException, reason);
}
// The failure of a read of four bytes at offset in data of length bytes.
[[noreturn]] void beyondBounds(uint64_t length, uint64_t offset);

// 64-bit FNV-1a of the bytes: the same in every process and release, so a
// crash flag written by one process is found by the next.
uint64_t stableHash(ByteView bytes);
// The same hash carried on over more bytes.
uint64_t stableHash(ByteView bytes, uint64_t carried);
inline constexpr uint64_t kHashSeed = 14695981039346656037ull;

// "~/.local/share/NubiloSyncClient/<hash>.cflag"
std::string crashFlagPath(uint64_t hash);

// The writers' shared pieces: the "CreationTimestamp" text of now, and the
// text of a zero-terminated field, refused (std::invalid_argument) when it
// holds a zero byte, which would cut it short for every reader.
std::string creationTimestamp();
const std::string& textWithoutZero(const std::string& text, const char* what);
// The header lines of a changelog in file order, "key=value" each.
std::vector<std::string> headerLines(const Dictionary& headers);

}  // namespace vtc::clog
