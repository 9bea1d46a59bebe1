// The sync engine's change object, carried inside changelogs: a change type,
// the record's identifier and its ordered property-level changes.
#pragma once

#include <cstdint>
#include <string>
#include <utility>

#include "VantorSyncManager/Export.h"
#include "VantorSyncManager/Value.h"

class VSM_EXPORT SyncEngineChange {
 public:
  enum Type : uint32_t { kAdd = 1, kModify = 2, kDelete = 3 };

  SyncEngineChange() = default;
  // Each entry of `changes` is a property-change dictionary with the keys
  // "action" ("set" or "clear"), "name" and, for "set", "value".
  SyncEngineChange(uint32_t type, std::string recordIdentifier, vtc::Array changes)
      : type_(type), recordIdentifier_(std::move(recordIdentifier)), changes_(std::move(changes)) {}

  uint32_t type() const { return type_; }
  const std::string& recordIdentifier() const { return recordIdentifier_; }
  const vtc::Array& changes() const { return changes_; }

  std::string description() const;
  friend bool operator==(const SyncEngineChange& a, const SyncEngineChange& b) = default;

 private:
  uint32_t type_ = kAdd;
  std::string recordIdentifier_;
  vtc::Array changes_;
};
