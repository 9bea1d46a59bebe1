// The folders this computer syncs: one vdir collection per dataclass, kept
// in the per-host preferences under "SyncCollections".
#pragma once

#include <optional>
#include <string>
#include <vector>

#include "client/stores/VdirItem.h"

namespace vtc::client {

struct Collection {
  std::string dataclass;
  ItemKind kind = ItemKind::Contacts;
  std::string folder;  // absolute
};

inline constexpr const char* kDefaultContactsDataclass = "com.korvo.Contacts";
inline constexpr const char* kDefaultCalendarsDataclass = "com.korvo.Calendars";

// "contacts" or "calendars"; none for any other word.
std::optional<ItemKind> kindFromWord(const std::string& word);
const char* kindWord(ItemKind kind);

std::vector<Collection> configuredCollections();
std::optional<Collection> configuredCollection(const std::string& dataclass);
// Adds a collection; raises SyncFailure (Usage) when the name is not plain,
// or the dataclass or the folder is already synced.
// Raises SyncFailure (Usage) with a sentence when the name is not a plain
// dataclass name (see session/DataclassName.h).
void requirePlainDataclassName(const std::string& dataclass);

// The folders kept in the preferences; an entry whose name is not a plain
// dataclass name is left out (Warning logged).
void addCollection(const Collection& collection);
// Stops syncing a dataclass; false when it was not synced.
bool removeCollection(const std::string& dataclass);

}  // namespace vtc::client
