// What runs that were cut short leave behind, removed by the next sync: in
// the folder, the temporary files of writes; on the share, the temporary
// changelogs of commits and the changelogs below minversion that an
// interrupted compaction did not delete. No run needs any of them. Nothing
// here fails a sync: what cannot be removed is logged and tried again by
// the next one.
#pragma once

#include <string>

#include "VantorSyncManager/NubiloRemoteSession.h"
#include "client/run/ServerView.h"
#include "client/stores/VdirCollection.h"

namespace vtc::client {

// Call while this run owns the sync: no other run then writes the folder.
void removeFolderLeftovers(const VdirCollection& folder);

// Call while holding the dataclass lock, with the record read under it. A
// temporary changelog goes once it is older than a lock lasts (the run
// that made it has lost its lock, so it can never move it into place);
// changelogs below minversion go only while the changelog at minversion
// is there (a record that names a missing one is set right by the fetch,
// and may then need them).
void removeShareLeftovers(NubiloRemoteSession& session, const std::string& dataclass,
                          const DataclassRecord& record);

}  // namespace vtc::client
