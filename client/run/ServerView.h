// What one request tells of the share: every dataclass's registry record
// and entity tag (a depth-1 listing of the schemas collection). A sync
// decides from it whether anything is to be fetched.
#pragma once

#include <map>
#include <optional>
#include <string>

#include "VantorSyncManager/NubiloRemoteSession.h"
#include "VantorSyncManager/Value.h"

namespace vtc::client {

struct DataclassRecord {
  std::optional<int64_t> minversion;
  std::optional<int64_t> maxversion;
  std::string status;
  std::string etag;
  // Written by a compaction: the changelog whose truth the reset at
  // minversion holds, and a digest of that truth (see truthDigest).
  std::optional<int64_t> truthIndex;
  std::string truthDigest;
  // The vdir folder's name and colour (CollectionMeta.h), when set.
  std::optional<std::string> collectionName, collectionColor;

  static DataclassRecord fromRecord(const Dictionary& record);  // getDataclassInfo's form
};

class ServerView {
 public:
  // One PROPFIND; raises what the session raises (a network failure).
  static ServerView read(NubiloRemoteSession& session);
  // The dataclass's record; none when the share has no such dataclass.
  std::optional<DataclassRecord> record(const std::string& dataclass) const;

 private:
  std::map<std::string, DataclassRecord> records_;
};

// What the network side of this computer has taken in of a dataclass,
// kept in the engine with the network client's state.
struct NetworkState {
  std::optional<int64_t> index;       // the last changelog applied or committed
  std::optional<int64_t> minversion;  // the record's minversion then
  static NetworkState fromValue(const Value& value);
  Value toValue() const;
};

}  // namespace vtc::client
