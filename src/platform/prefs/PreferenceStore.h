// The platform preference store: domains of keys and property-list values at
// per-user (any host) and per-host scope, kept as property-list files.
// Reads come from an in-memory copy; writes are pending until synchronize(),
// which takes an advisory lock, re-reads the file, applies only this
// process's pending changes and replaces the file atomically, so processes
// that write different keys lose nothing. A corrupt file is moved aside with
// an Error line and read as empty. Thread-safe.
#pragma once

#include <map>
#include <mutex>
#include <set>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "VantorSyncManager/Value.h"

namespace vtc::prefs {

enum class Scope { AnyHost, CurrentHost };

class PreferenceStore {
 public:
  static PreferenceStore& shared();

  // The key's value, or none.
  Value copyValue(std::string_view key, std::string_view domain, Scope scope);
  // A none value removes the key.
  void setValue(std::string_view key, Value value, std::string_view domain, Scope scope);
  std::vector<std::string> copyKeyList(std::string_view domain, Scope scope);
  // The values of the keys that are present (all keys when keys is empty).
  Dictionary copyMultiple(const std::vector<std::string>& keys, std::string_view domain,
                          Scope scope);
  void setMultiple(const Dictionary& values, const std::vector<std::string>& removals,
                   std::string_view domain, Scope scope);
  // Writes pending changes and re-reads the file; false when the write failed
  // (the changes stay pending for the next try).
  bool synchronize(std::string_view domain, Scope scope);

  // The value at per-host scope, else at per-user scope.
  Value copyAppValue(std::string_view key, std::string_view domain);

  // Forgets every in-memory copy and pending change (tests only).
  void resetForTesting();

 private:
  struct Domain {
    bool loaded = false;
    Dictionary values;  // the file as last read, with pending changes applied
    Dictionary pendingSets;
    std::set<std::string> pendingRemovals;
  };
  using Key = std::pair<std::string, Scope>;

  Domain& load(const Key& key, std::vector<std::string>& problems);
  static std::string pathOf(const Key& key);

  std::mutex mutex_;
  std::map<Key, Domain> domains_;
};

}  // namespace vtc::prefs
