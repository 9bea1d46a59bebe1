// A plain HTTP(S) GET of a URL into memory, without credentials or caching.
#pragma once

#include <optional>
#include <string>

#include "VantorSyncManager/Value.h"

namespace vtc {

// The body of a 2xx answer, or nullopt with *error describing the failure.
std::optional<Bytes> fetchURL(const std::string& url, std::string* error, int timeoutSeconds = 30);

}  // namespace vtc
