// NubiloChangeLog: construction, headers, schema versions and text forms.
#include "VantorSyncManager/NubiloChangeLog.h"

#include <cstdio>
#include <fstream>
#include <iterator>

#include "VantorSyncManager/VTCPrefsCenter.h"
#include "changelog/ChangeLogFormat.h"
#include "common/Format.h"
#include "platform/engine/SyncEngine.h"

std::unique_ptr<NubiloChangeLog> NubiloChangeLog::createChangeLogWithData(vtc::ByteView data,
                                                                          size_t threshold) {
  if (data.size() < threshold) return std::make_unique<NubiloChangeLog>(data);
  return std::make_unique<NubiloMappedChangelog>(data);
}

std::unique_ptr<NubiloChangeLog> NubiloChangeLog::changeLogWithContentsOfFile(
    const std::string& path) {
  // A file that cannot be read gives no bytes, and no bytes an empty
  // changelog (with the reader's Error line), not a failure.
  std::ifstream in(path, std::ios::binary);
  vtc::Bytes bytes;
  if (in) bytes.assign(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
  return std::make_unique<NubiloChangeLog>(bytes);
}

NubiloChangeLog::NubiloChangeLog(vtc::ByteView data) {
  parseData(data);
}

NubiloChangeLog::NubiloChangeLog(std::vector<SyncEngineChange> changes)
    : _changes(std::move(changes)), _headers(vtc::Dictionary{}) {
  _headers->set("OSVersion", vtc::Value(VTCPrefsCenter::defaultCenter().systemVersion()));
  _headers->set("CreatorEngineVersion", vtc::Value(vtc::engine::SyncEngine::bundleVersion()));
  _headers->set("CreatorClientType", vtc::Value(vtc::clog::kClientType));
}

NubiloChangeLog::~NubiloChangeLog() = default;

void NubiloChangeLog::setHeaderValue(const vtc::Value& value, const std::string& key) {
  if (value.isNone() || key.empty()) return;
  if (!_headers) _headers = vtc::Dictionary{};
  _headers->set(key, value);
}

vtc::Value NubiloChangeLog::headerValueForKey(const std::string& key) {
  return _headers ? _headers->get(key) : vtc::Value();
}

const vtc::Dictionary& NubiloChangeLog::headers() {
  static const vtc::Dictionary kNone;
  return _headers ? *_headers : kNone;
}

const std::vector<SyncEngineChange>& NubiloChangeLog::changes() {
  return _changes;
}

void NubiloChangeLog::setSchemaVersions(const vtc::Array& versions) {
  for (const vtc::Value& v : versions) {
    const vtc::Dictionary& d = v.dictionary();
    const vtc::Value* name = d.find("Name");
    const vtc::Value* major = d.find("MajorVersion");
    const vtc::Value* minor = d.find("MinorVersion");
    if (!name || !major || !minor) continue;
    setHeaderValue(vtc::Value(vtc::format("%@.%@", *major, *minor)),
                   vtc::textOf(*name) + ".Version");
  }
}

std::optional<vtc::Array> NubiloChangeLog::getSchemaVersions() {
  vtc::Array out;
  for (const auto& [key, value] : headers()) {
    if (!key.ends_with(".Version")) continue;
    std::string text = vtc::textOf(value);
    size_t dot = text.find('.');
    if (dot == std::string::npos || text.find('.', dot + 1) != std::string::npos) continue;
    out.push_back(
        vtc::Value(vtc::Dictionary{{"Name", key.substr(0, key.size() - 8)},
                                   {"MajorVersion", vtc::Value(text.substr(0, dot)).integer()},
                                   {"MinorVersion", vtc::Value(text.substr(dot + 1)).integer()}}));
  }
  if (out.empty()) return std::nullopt;
  return out;
}

std::string NubiloChangeLog::summary() const {
  int counts[4] = {0, 0, 0, 0};
  for (const auto& c : _changes)
    if (c.type() >= 1 && c.type() <= 3) ++counts[c.type()];
  const vtc::Dictionary none;
  const vtc::Dictionary& h = _headers ? *_headers : none;
  return vtc::format("\t%@\t%@\t%@\t%d\t%d\t%d\n", h.get("OSVersion"),
                     h.get("CreatorClientVersion"), h.get("CreationTimestamp"), counts[1],
                     counts[2], counts[3]);
}

std::string NubiloChangeLog::description() const {
  std::string out = vtc::format("\nNum Records:%d\n", _changes.size());
  out += "Change log headers: \n";
  if (_headers)
    for (const auto& [key, value] : *_headers) out += vtc::format("%@=%@\n", key, value);
  if (_changes.size() <= 9999) {
    out += "\n";
    for (const auto& c : _changes) out += vtc::format("%@\n\n", c);
  } else {
    out += "(Too many changes to display, showing header info only)";
  }
  return out;
}

void NubiloChangeLog::dumpToTextFile(const std::string& path, bool includingSummary) {
  std::FILE* f = std::fopen(path.c_str(), "w");
  if (!f) return;  // a dump is a diagnostic: nothing to report it to
  if (includingSummary) std::fputs(summary().c_str(), f);
  std::fprintf(f, "Num Records:%zu\nChange log headers: \n", _changes.size());
  if (_headers)
    for (const auto& [key, value] : *_headers)
      std::fprintf(f, "%s=%s\n", key.c_str(), vtc::textOf(value).c_str());
  std::fputs("\n", f);
  for (const auto& c : _changes) std::fprintf(f, "%s\n\n", c.description().c_str());
  std::fclose(f);
}

void NubiloChangeLog::printChangeLog() {
  dumpToTextFile("/dev/stdout", false);
}
