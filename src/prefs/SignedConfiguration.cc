#include "prefs/ClientConfiguration.h"

namespace vtc::config {

std::optional<Dictionary> verifiedConfiguration(const Bytes&) {
  return std::nullopt;
}

}  // namespace vtc::config
