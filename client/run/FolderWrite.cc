#include "client/run/FolderWrite.h"

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <set>

#include "changelog/ChangeLogFormat.h"
#include "client/items/ItemRecord.h"
#include "client/run/FolderRead.h"
#include "client/run/SupportFolder.h"
#include "client/stores/ItemFiles.h"
#include "common/Clock.h"
#include "common/Logging.h"
#include "platform/fs/AtomicWrite.h"
#include "platform/fs/LocalPaths.h"

namespace vtc::client {

namespace {

bool isPlainCharacter(char c) {
  return (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') || (c >= '0' && c <= '9') || c == '@' ||
         c == '.' || c == '_' || c == '-' || c == '+';
}

}  // namespace

bool isAcceptableFileName(const std::string& name, ItemKind kind) {
  if (!isItemFileName(name, kind) || name.size() > 255) return false;
  for (char c : name)
    if (c == '/' || static_cast<unsigned char>(c) < 0x20 || c == 0x7F) return false;
  return true;
}

std::string fileNameFor(const std::string& identity, ItemKind kind) {
  const std::string extension = itemExtension(kind);
  bool plain = !identity.empty() && identity.size() <= 200 && identity.front() != '.';
  for (char c : identity) plain = plain && isPlainCharacter(c);
  if (plain) return identity + extension;
  const uint64_t h = clog::stableHash(
      ByteView(reinterpret_cast<const uint8_t*>(identity.data()), identity.size()));
  char buffer[17];
  std::snprintf(buffer, sizeof buffer, "%016llx", static_cast<unsigned long long>(h));
  return buffer + extension;
}

FolderWriteResult FolderWriter::write() {
  FolderWriteResult result;
  const std::vector<std::string> takes = engine.folderTakes(client, dataclass);
  if (takes.empty()) return result;
  const ItemKind kind = folder.kind();
  std::map<std::string, ItemState> loaded;
  if (!this->known) loaded = knownFiles(engine, client, dataclass);
  std::map<std::string, ItemState>& known = this->known ? *this->known : loaded;
  std::map<std::string, std::string> fileOf;
  for (const auto& [name, state] : known) fileOf.emplace(state.record, name);
  const std::map<std::string, Dictionary> truth = engine.recordsWithIdentifiers(dataclass, takes);
  std::vector<std::string> current;
  for (const std::string& id : takes)
    if (auto f = fileOf.find(id); f != fileOf.end()) current.push_back(f->second);
  std::map<std::string, Value> details = engine.itemDetails(client, dataclass, current);

  engine::FolderUpdate update;
  auto origin = [&](const std::string& id) {
    if (!origins) return std::string();
    auto it = origins->find(id);
    return it == origins->end() ? std::string() : it->second;
  };
  // The bytes of a record set aside are kept where the user can read them.
  const std::string asideFolder = paths::join(paths::join(supportFolder(), "SetAside"), dataclass);
  auto setAside = [&](const std::string& id, const std::string& file, const std::string& why,
                      const std::optional<std::string>& bytes) {
    VTC_LOG_WARNING("Setting aside record %@ of %@ (%@): %@", id, dataclass, file, why);
    if (bytes) {
      paths::makeDirectories(asideFolder, 0700);
      if (!fs::writeFileAtomically(paths::join(asideFolder, fileNameFor(id, kind)), *bytes, 0600))
        VTC_LOG_ERROR("Could not keep the bytes of record %@ in %@", id, asideFolder);
    }
    result.setAside.push_back({file, why, origin(id)});
    update.setAside.emplace_back(id, engine::SetAside{file, why, origin(id), currentClock().now()});
    update.taken.push_back(id);
  };
  auto removeFile = [&](const std::string& name) -> bool {
    const WriteOutcome r = folder.remove(name, known.at(name));
    if (r == WriteOutcome::Removed) {
      update.state.items.emplace_back(name, std::nullopt);
      known.erase(name);
      return true;
    }
    if (r == WriteOutcome::SkippedChangedOnDisk)
      ++result.skipped;
    else
      result.failures.push_back(name + ": " + strerror(errno));
    return false;
  };

  // Made durable together at the end, before the engine hears of them.
  folder.deferFlushes(true);
  size_t done = 0;
  int64_t bytesWritten = 0;
  for (const std::string& id : takes) {
    if (progress && (done++ & 63) == 0)
      progress->step(dataclass, "writing files", done - 1, takes.size(), bytesWritten);
    auto have = fileOf.find(id);
    const std::string* currentFile = have == fileOf.end() ? nullptr : &have->second;
    auto record = truth.find(id);
    if (record == truth.end()) {  // deleted
      if (!currentFile || removeFile(*currentFile)) {
        update.taken.push_back(id);
        update.setAside.emplace_back(id, std::nullopt);
        if (currentFile) ++result.written;
      }
      continue;
    }
    const Dictionary& merged = record->second;
    std::string target = recordFile(merged);
    if (!isAcceptableFileName(target, kind) ||
        (known.count(target) && (!currentFile || target != *currentFile)))
      target = currentFile ? *currentFile : fileNameFor(id, kind);

    // The file as the engine last recorded it: unchanged since, its record
    // is the one stored, and its bytes need no reading.
    const Dictionary* local = nullptr;
    if (currentFile) {
      const std::optional<ItemState> onDisk = folder.stat(*currentFile);
      if (onDisk && !onDisk->sameFileAs(known.at(*currentFile))) {
        ++result.skipped;  // changed since the sync read it: the next sync reads it first
        continue;
      }
      const Value& detail = details[*currentFile];
      if (detail.isDictionary()) local = &detail.dictionary();
    }
    std::string problem;
    Dictionary written;
    std::optional<std::string> bytes = renderRecord(merged, local, &problem, &written);
    if (!bytes || !readItemText(kind, *bytes, &problem)) {
      setAside(id, target, problem, bytes);
      continue;
    }
    written.set(kFileField, Value(target));
    if (local && target == *currentFile && written == *local) {
      // Nothing to write: the file means what the truth says.
      update.taken.push_back(id);
      update.setAside.emplace_back(id, std::nullopt);
      continue;
    }
    const bool inPlace = currentFile && target == *currentFile;
    ItemState state;
    const WriteOutcome r =
        folder.write(target, *bytes,
                     inPlace ? std::optional<ItemState>(known.at(target)) : std::nullopt, &state);
    if (r == WriteOutcome::SkippedChangedOnDisk) {
      ++result.skipped;
      continue;
    }
    if (r == WriteOutcome::Failed) {
      result.failures.push_back(target + ": " + strerror(errno));
      continue;
    }
    bytesWritten += static_cast<int64_t>(bytes->size());
    // A file that holds its record's truth byte for byte keeps none of its own.
    update.state.items.emplace_back(
        target, engine::StoredItem{{state.size, state.modifiedNanoseconds, state.changedNanoseconds,
                                    state.inode, id},
                                   written == merged ? Value() : Value(std::move(written))});
    state.record = id;
    known[target] = state;
    if (currentFile && !inPlace) removeFile(*currentFile);
    update.taken.push_back(id);
    update.setAside.emplace_back(id, std::nullopt);
    ++result.written;
    result.names.push_back(displayName(merged));
  }
  if (!folder.flush()) {
    // Nothing is recorded: the next sync writes these files again.
    result.failures.push_back(folder.folder() + ": " + strerror(errno));
    return result;
  }
  engine.storeFolderUpdate(client, dataclass, update);
  return result;
}

}  // namespace vtc::client
