// A plain HTTP(S) GET of a URL into memory, without credentials or caching,
// within a deadline for the whole answer and a cap on its size.
#pragma once

#include <optional>
#include <string>

#include "VantorSyncManager/Value.h"

namespace vtc {

// The body of a 2xx answer, or nullopt with *error describing the failure
// (an answer larger than maxBytes is given up as it arrives; limitKey is
// the configuration key named in the sentence).
std::optional<Bytes> fetchURL(const std::string& url, std::string* error, uint64_t maxBytes,
                              const char* limitKey, int timeoutSeconds = 30);

}  // namespace vtc
