// What a folder says at the start of a sync: the records whose files
// changed, appeared or went since the last sync, each with the record its
// file held before and the file it holds now. Items are known by their
// identity, so a file renamed is one record, not a delete and an add, and
// two files holding one item are both left out until the user resolves it.
#pragma once

#include <map>
#include <optional>
#include <string>
#include <vector>

#include "client/stores/VdirCollection.h"
#include "platform/engine/SyncEngine.h"

namespace vtc::client {

struct LocalRecord {
  std::optional<Dictionary> before;  // the record its file held when last read or written
  const ItemFile* now = nullptr;     // the file that holds it now (none: no file)
  std::string file;                  // that file's name, or the name of the file that went
  std::string oldFile;               // a renamed item's file before
};

struct FolderRead {
  ScanResult scan;  // states carry the record each file holds
  std::map<std::string, LocalRecord> records;
  std::vector<std::pair<std::string, std::string>> invalid;  // file, why
  size_t knownFiles = 0;  // item files the folder held at the last sync
};

// Reads the folder against what the engine knows of it (client: the
// folder's engine client). Raises std::runtime_error for an unreadable
// folder.
FolderRead readFolder(const VdirCollection& folder, engine::SyncEngine& engine,
                      const std::string& client, const std::string& dataclass);

// The engine's stamps of a folder's files as item states.
std::map<std::string, ItemState> knownFiles(engine::SyncEngine& engine, const std::string& client,
                                            const std::string& dataclass);

}  // namespace vtc::client
