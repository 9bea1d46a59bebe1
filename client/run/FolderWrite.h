// Writing the truth into a folder: every record the folder still has to
// take in is written to its file (over the file's own bytes where they
// mean the same), renamed, or removed. A file changed since the sync read
// it is left for the next sync; a record that makes no valid item is set
// aside and named, never written. All writes reach the disk together
// before the engine records them as written.
#pragma once

#include <map>
#include <string>
#include <vector>

#include "client/run/Progress.h"
#include "client/stores/VdirCollection.h"
#include "platform/engine/SyncEngine.h"

namespace vtc::client {

struct SetAsideItem {
  std::string file;
  std::string reason;
  std::string origin;  // the computer that sent it, when known
};

struct FolderWriteResult {
  size_t written = 0;                 // files written, renamed or removed
  size_t skipped = 0;                 // changed on disk meanwhile: left for the next sync
  std::vector<std::string> failures;  // files that could not be written: why
  std::vector<SetAsideItem> setAside;
  std::vector<std::string> names;  // the items written, by their names
};

struct FolderWriter {
  VdirCollection& folder;
  engine::SyncEngine& engine;
  std::string client;  // the folder's engine client
  std::string dataclass;
  // The computers that last changed records in this run, for set-aside notes.
  const std::map<std::string, std::string>* origins = nullptr;
  Progress* progress = nullptr;
  // The folder's item states as the engine holds them, when the caller has
  // them already (kept up to date with what is written); else read.
  std::map<std::string, ItemState>* known = nullptr;

  FolderWriteResult write();
};

// A file name for an item that has none it can use: its identity where
// that is a plain name, else a digest of it; with the kind's extension.
std::string fileNameFor(const std::string& identity, ItemKind kind);
// Whether a name from elsewhere can name an item file in a folder of this
// kind: a plain name with the kind's extension.
bool isAcceptableFileName(const std::string& name, ItemKind kind);

}  // namespace vtc::client
