// A changelog written record by record into a file: each record's archive
// is deflated into a temporary body file as it comes, so memory follows one
// record, not the changelog; finish() puts the index and the header lines in
// front of the body. The file is what NubiloChangeLog::writeToData makes of
// the same changes (the compressed body may differ in its deflate blocks;
// every reader inflates both alike). Not thread-safe.
#pragma once

#include <zlib.h>

#include <cstdint>
#include <string>
#include <vector>

#include "VantorSyncManager/SyncEngineChange.h"
#include "VantorSyncManager/Value.h"
#include "platform/plist/BinaryPlistWriter.h"

namespace vtc::clog {

class ChangeLogFileWriter {
 public:
  // Temporary files go into folder; on failure to make them, raises
  // std::runtime_error.
  explicit ChangeLogFileWriter(const std::string& folder);
  // Removes the temporary body file (the finished changelog stays).
  ~ChangeLogFileWriter();
  ChangeLogFileWriter(const ChangeLogFileWriter&) = delete;
  ChangeLogFileWriter& operator=(const ChangeLogFileWriter&) = delete;

  // Headers as NubiloChangeLog keeps them; the creator headers are set.
  void setHeaderValue(const Value& value, const std::string& key);
  void setSchemaVersions(const Array& versions);

  // Appends a change. What every reader would refuse (a zero byte in the
  // identifier, nesting too deep) raises std::invalid_argument, and nothing
  // is appended.
  void append(const SyncEngineChange& change);
  size_t count() const { return offsets_.size(); }
  // Uncompressed bytes of the records so far.
  uint64_t bodySize() const { return bodySize_; }

  // Writes the changelog file at path: index, headers, the compressed body.
  // Raises std::runtime_error when a write fails. Nothing may be appended
  // after.
  void finish(const std::string& path);

 private:
  void deflateOut(const uint8_t* data, size_t size, int flush);

  std::string bodyPath_;
  int bodyFd_ = -1;
  z_stream z_{};
  bool finished_ = false;
  Dictionary headers_;
  std::vector<uint32_t> offsets_;
  uint64_t bodySize_ = 0;
  Bytes record_;  // one record, reused
  plist::BinaryPlistWriter archiver_;
};

}  // namespace vtc::clog
