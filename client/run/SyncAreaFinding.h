// What setup finds at the address of a sync area before it changes
// anything: the account's sync area and the computers that use it, or a
// place where a new, empty one would start, and whether a new one there is
// what the share suggests. Reads only.
#pragma once

#include <optional>
#include <string>
#include <vector>

#include "VantorSyncManager/NubiloRemoteSession.h"
#include "VantorSyncManager/Value.h"

namespace vtc::client {

struct AreaComputer {
  std::string name;
  std::optional<Date> lastSync;
};

struct SyncAreaFinding {
  enum class Kind {
    SyncArea,     // holds Clients/ and Schemas/
    Missing,      // nothing there
    EmptyFolder,  // an empty collection
    OtherFolder,  // a collection of other things
  };
  Kind kind = Kind::Missing;
  // SyncArea: the computers of the account other than this one.
  std::vector<AreaComputer> others;
  // Otherwise: a sync area in the same folder (its path in the share), the
  // one the address most likely meant.
  std::optional<std::string> areaBeside;

  bool startsNewArea() const { return kind != Kind::SyncArea; }
  // A new area where none was expected: beside another, or among other
  // files.
  bool unexpected() const {
    return startsNewArea() && (areaBeside.has_value() || kind == Kind::OtherFolder);
  }
};

// Looks at session's sync area (session opened without creating it). A
// computer whose guid is ownGuid is this one. Raises SyncFailure
// (ServerUnsuitable) when the area cannot be read.
SyncAreaFinding findSyncArea(NubiloRemoteSession& session, const std::string& ownGuid);

}  // namespace vtc::client
