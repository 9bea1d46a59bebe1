// Maintenance of the server's dataclasses for callers that hold no session.
// Each call opens its own session from the stored account and the
// preferences' configuration, does one thing, and turns every failure into an
// Error line and a neutral result: no exception derived from std::exception
// leaves these functions. Calls may come from any thread.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "VantorSyncManager/Export.h"
#include "VantorSyncManager/Value.h"

// Unregisters each dataclass in turn. True when every one was removed (also
// for an empty list); false when any removal failed, the others still done,
// or when a failure stopped the loop (those already removed stay removed).
VSM_EXPORT bool removeNubiloDataclasses(const std::vector<std::string>& dataclasses);

// The bytes the dataclass occupies on the server. A value recorded in the
// preferences is returned without any request; otherwise it is worked out,
// recorded and returned. Nothing when it cannot be worked out.
VSM_EXPORT std::optional<int64_t> approximateStorageUsedByDataclass(const std::string& dataclass);

// The "dataclassname" of every dataclass collection, in the server's order,
// a none value for a collection without one; empty when the server's listing
// failed, nothing after any other failure.
VSM_EXPORT std::optional<vtc::Array> registeredDataclasses();
