// What bytes from outside (the share, other computers, the push server, a
// configuration server) may cost this process. Every decoder works within a
// budget proportional to the bytes it was given, and under absolute caps
// that the user can raise through configuration keys. One set of caps per
// process; set it before requests are made (the configuration does so).
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "VantorSyncManager/Value.h"

namespace vtc {

struct Limits {
  // A changelog as downloaded (compressed).
  uint64_t changelogBytes = uint64_t{256} << 20;
  // What a changelog's body may inflate to: this many times its compressed
  // size (at least kInflateFloor), and never more than inflatedBytes.
  uint64_t inflateRatio = 256;
  uint64_t inflatedBytes = uint64_t{1} << 30;
  // The memory a decoded changelog may take (values and their text).
  uint64_t decodedBytes = uint64_t{1} << 30;
  // Any other answer read into memory: PROPFIND, reports, lock answers.
  uint64_t answerBytes = uint64_t{16} << 20;
  // One push message, and the signed configuration download.
  uint64_t pushMessageBytes = uint64_t{64} << 10;
  uint64_t configurationBytes = uint64_t{1} << 20;

  // The configuration keys, in the unit each names.
  static constexpr const char* kChangelogKey = "max_changelog_megabytes";
  static constexpr const char* kInflateRatioKey = "max_changelog_inflate_ratio";
  static constexpr const char* kInflatedKey = "max_changelog_inflated_megabytes";
  static constexpr const char* kDecodedKey = "max_changelog_decoded_megabytes";
  static constexpr const char* kAnswerKey = "max_answer_megabytes";
  static constexpr const char* kPushMessageKey = "max_push_message_kilobytes";
  static constexpr const char* kConfigurationKey = "max_configuration_kilobytes";

  // A small changelog may always inflate to this much.
  static constexpr uint64_t kInflateFloor = uint64_t{1} << 20;
  // A decoded changelog may take this many bytes of memory per byte it was
  // given (at least kDecodedFloor): thirty to a hundred is usual, two
  // hundred for records that repeat one another.
  static constexpr uint64_t kDecodedPerByte = 512;
  static constexpr uint64_t kDecodedFloor = uint64_t{32} << 20;

  // The budget of a changelog of this compressed size.
  uint64_t inflateBudget(uint64_t compressed) const;
  uint64_t decodeBudget(uint64_t compressed) const;

  // The defaults, with every positive value of the keys above taken from
  // the configuration.
  static Limits fromConfiguration(const Dictionary& configuration);
};

const Limits& limits();
void setLimits(const Limits& limits);

// The sentence for input over a cap: what was refused, the size allowed,
// and the configuration key that raises it. overLimitIn finds the size and
// the key in such a sentence, or in any text that quotes one.
std::string overLimitText(std::string_view what, uint64_t allowedBytes, std::string_view key);
struct OverLimit {
  std::string allowed;  // "16 MB", or "262144 XML elements"
  std::string key;
};
std::optional<OverLimit> overLimitIn(std::string_view text);

// "64 KB", "16 MB", "1.5 GB".
std::string byteCountText(uint64_t bytes);

}  // namespace vtc
