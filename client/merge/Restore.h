// Bringing back the losing side of a kept conflict: a pure function of
// records that gives the record to write, so that the next sync sends it
// as an ordinary edit.
#pragma once

#include <optional>
#include <string>

#include "VantorSyncManager/Value.h"
#include "client/stores/VdirItem.h"

namespace vtc::client::merge {

// The record with `lost` back under `field` (a field's key, a component,
// or "(record)"), over `current` (the file's record now; none: the file is
// gone, and `item`, the record as it stood when the conflict was kept, is
// the start). None: the losing side was a delete of the record, which is
// deleted again.
std::optional<Dictionary> restoredRecord(ItemKind kind, const std::optional<Dictionary>& current,
                                         const std::string& field, const Value& lost,
                                         const Dictionary& item);

}  // namespace vtc::client::merge
