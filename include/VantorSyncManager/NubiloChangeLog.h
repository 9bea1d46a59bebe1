// A changelog: one numbered file of changes of one dataclass. A binary
// index, text headers, and a compressed body of change records; every
// integer unsigned 32-bit big-endian. Reading failures raise
// NubiloCorruptChangelogException; writing refuses, with
// std::invalid_argument, what every reader would refuse. Not thread-safe.
//
// Reading works within a budget proportional to the bytes given (vtc::Limits
// holds the caps): the body may inflate to a bounded multiple of its size,
// and the decoded changes may take a bounded multiple in memory. A record
// whose own archive cannot be decoded, or would go over its budget, is
// passed over and listed in refusedChanges(); a damaged frame (index,
// headers, a body that does not inflate, a cut record) refuses the whole
// changelog.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "VantorSyncManager/Export.h"
#include "VantorSyncManager/SyncEngineChange.h"
#include "VantorSyncManager/Value.h"

namespace vtc {
// A record of a changelog that was read past: its place in the changelog
// (from 0), its identifier, and why its changes could not be taken.
struct RefusedChange {
  size_t position;
  std::string recordIdentifier;
  std::string reason;
};
}  // namespace vtc

class VSM_EXPORT NubiloChangeLog {
 public:
  // A NubiloChangeLog below the threshold, a NubiloMappedChangelog from it on.
  static std::unique_ptr<NubiloChangeLog> createChangeLogWithData(vtc::ByteView data,
                                                                  size_t threshold);
  // The file read whole and decoded: raises when it cannot be decoded; one
  // that cannot be read gives an empty changelog, as no bytes do.
  static std::unique_ptr<NubiloChangeLog> changeLogWithContentsOfFile(const std::string& path);

  NubiloChangeLog() = default;
  // initWithData: decodes the bytes.
  explicit NubiloChangeLog(vtc::ByteView data);
  // initWithChanges: a changelog to be written, with the creator headers set.
  explicit NubiloChangeLog(std::vector<SyncEngineChange> changes);
  virtual ~NubiloChangeLog();

  // The reader: on failure the changelog is unchanged. The writer: changes
  // nested deeper than readers read, or a record identifier or header line
  // holding a zero byte, raise std::invalid_argument with output untouched.
  void parseData(vtc::ByteView data);
  virtual void writeToData(vtc::Bytes& output);

  virtual void setHeaderValue(const vtc::Value& value, const std::string& key);
  virtual vtc::Value headerValueForKey(const std::string& key);
  virtual const vtc::Dictionary& headers();
  virtual const std::vector<SyncEngineChange>& changes();
  // The records read past, in file order; empty when every record decoded.
  // A mapped changelog knows them once changes() has decoded it.
  const std::vector<vtc::RefusedChange>& refusedChanges() const { return _refusedChanges; }
  // One "<Name>.Version" header per schema with "Name", "MajorVersion" and
  // "MinorVersion"; getSchemaVersions gives them back, or nothing.
  virtual void setSchemaVersions(const vtc::Array& versions);
  virtual std::optional<vtc::Array> getSchemaVersions();

  std::string description() const;
  std::string summary() const;
  virtual void dumpToTextFile(const std::string& path, bool includingSummary);
  virtual void printChangeLog();

  uint32_t version() const { return _version; }

  // Crash flags: a decode under way is marked on disk, so that a changelog
  // that killed the process while decoding is refused on a later attempt.
  void setCrashFlagForHash(uint64_t hash);
  void clearCrashFlagForHash(uint64_t hash);

 protected:
  // Told as the reader moves past input bytes that it will not read again.
  virtual void inputConsumed(const uint8_t* begin, const uint8_t* end);

  std::vector<SyncEngineChange> _changes;
  std::vector<vtc::RefusedChange> _refusedChanges;
  uint32_t _version = 0;
  std::optional<vtc::Dictionary> _headers;
};

// A large downloaded changelog, held in a memory-mapped temporary file and
// decoded only when first looked at. Its setters refuse to work.
class VSM_EXPORT NubiloMappedChangelog : public NubiloChangeLog {
 public:
  // initWithData: the bytes go to a temporary file that is mapped.
  explicit NubiloMappedChangelog(vtc::ByteView data);
  // Maps this file, which the changelog then owns and deletes.
  static std::unique_ptr<NubiloMappedChangelog> adoptingFile(const std::string& path);
  ~NubiloMappedChangelog() override;

  void dumpToTextFile(const std::string& path, bool includingSummary) override;
  void printChangeLog() override;
  std::optional<vtc::Array> getSchemaVersions() override;
  const vtc::Dictionary& headers() override;
  const std::vector<SyncEngineChange>& changes() override;
  vtc::Value headerValueForKey(const std::string& key) override;
  void writeToData(vtc::Bytes& output) override;
  void setSchemaVersions(const vtc::Array& versions) override;
  void setHeaderValue(const vtc::Value& value, const std::string& key) override;

  // The lazy decode; a failure leaves the changelog undecoded.
  void parseData();
  bool isDecoded() const { return !_mappedData; }

 protected:
  // Gives consumed pages of the mapping back, so that reading a large file
  // does not keep all of it resident.
  void inputConsumed(const uint8_t* begin, const uint8_t* end) override;

 private:
  struct Mapping;
  NubiloMappedChangelog() = default;
  void release();
  std::string _mappedFile;
  std::unique_ptr<Mapping> _mappedData;
};
