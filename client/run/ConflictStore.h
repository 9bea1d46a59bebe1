// The losing values of conflicts, kept in the support folder ("Conflicts/",
// one property list each) so that nothing an edit wrote is ever lost. They
// are listed and restorable, never synced as records.
#pragma once

#include <optional>
#include <string>
#include <vector>

#include "VantorSyncManager/Value.h"
#include "platform/engine/SyncEngine.h"

namespace vtc::client {

struct KeptConflict {
  std::string id;
  std::string dataclass;
  std::string record;
  std::string field;
  Value kept;  // the value that stands (none: the field was cleared)
  Value lost;  // the value that lost (none: a clear lost)
  std::string keptComputer;
  std::string lostComputer;
  Date date;
};

class ConflictStore {
 public:
  ConflictStore();  // the support folder's "Conflicts"
  explicit ConflictStore(std::string folder);

  // Keeps the losing side of a conflict; raises std::runtime_error when it
  // cannot be written (the push that found it is then undone).
  KeptConflict keep(const engine::Conflict& conflict);
  // Oldest first.
  std::vector<KeptConflict> list() const;
  std::optional<KeptConflict> find(const std::string& id) const;
  bool drop(const std::string& id);

 private:
  std::string folder_;
};

}  // namespace vtc::client
