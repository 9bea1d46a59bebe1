// A vdir folder's own metadata, its "displayname" and "color" files,
// travelling with the collection as properties of the dataclass on the
// share (never as records). Each is merged by itself against the value
// both sides last agreed on: a change on one side goes to the other; when
// both changed, the share's stands, as it was synced first.
#pragma once

#include <optional>
#include <string>

#include "client/run/Collections.h"

class NubiloRemoteSession;

namespace vtc::client {

struct CollectionMeta {
  std::optional<std::string> displayname, color;
  friend bool operator==(const CollectionMeta&, const CollectionMeta&) = default;
};

// The properties on the share, as the dataclass record holds them.
inline constexpr const char* kCollectionNameProperty = "collectionname";
inline constexpr const char* kCollectionColorProperty = "collectioncolor";

// The folder's files: their first line, trimmed; none when absent, empty or
// longer than a line may be.
CollectionMeta readFolderMeta(const std::string& folder);

// Brings the folder's metadata and the share's in step after a sync of the
// dataclass; share: the values the share holds now. Failures are logged:
// metadata never fails a sync.
void syncCollectionMeta(NubiloRemoteSession& session, const Collection& collection,
                        const CollectionMeta& share);

}  // namespace vtc::client
