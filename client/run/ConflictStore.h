// The losing values of conflicts, kept in the support folder ("Conflicts/",
// one property list each) so that nothing an edit wrote is ever lost. They
// are listed and restorable, never synced as records.
#pragma once

#include <optional>
#include <string>
#include <vector>

#include "VantorSyncManager/Value.h"

namespace vtc::client {

struct KeptConflict {
  std::string id;  // given by keep()
  std::string dataclass;
  std::string record;  // the record's identity
  std::string file;    // its file name then
  std::string name;    // the contact's or event's name
  // A field's key, a component ("VEVENT/<recurrence-id>/<uid>"), or
  // "(record)": a whole version (lost holds the record) or a delete (lost
  // is none).
  std::string field;
  Value kept;       // the value that stands (none: the field is gone)
  Value lost;       // the value that lost (none: a removal lost)
  Dictionary item;  // the record as it stood, to write back one that is gone
  std::string keptComputer;
  std::string lostComputer;
  Date date;
};

class ConflictStore {
 public:
  ConflictStore();  // the support folder's "Conflicts"
  explicit ConflictStore(std::string folder);

  // Keeps the losing side of a conflict under a new id; raises
  // std::runtime_error when it cannot be written.
  KeptConflict keep(KeptConflict conflict);
  // Oldest first.
  std::vector<KeptConflict> list() const;
  std::optional<KeptConflict> find(const std::string& id) const;
  bool drop(const std::string& id);

 private:
  std::string folder_;
};

}  // namespace vtc::client
