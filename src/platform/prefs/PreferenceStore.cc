#include "platform/prefs/PreferenceStore.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <fstream>
#include <iterator>

#include "common/Logging.h"
#include "platform/fs/LocalPaths.h"
#include "platform/plist/PlistCodec.h"
#include "platform/prefs/PreferenceFiles.h"

namespace vtc::prefs {

namespace {

// Holds an advisory lock on "<file>.lock" for the life of the object. The
// lock file, not the preference file, is locked, because the preference
// file is replaced by rename and a lock on it would be left behind on the
// old inode.
class FileLock {
 public:
  explicit FileLock(const std::string& path) {
    fd_ = ::open((path + ".lock").c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600);
    if (fd_ >= 0) {
      while (::flock(fd_, LOCK_EX) != 0 && errno == EINTR) {
      }
    }
  }
  ~FileLock() {
    if (fd_ >= 0) ::close(fd_);  // closing releases the lock
  }

 private:
  int fd_ = -1;
};

// Reads a preference file. A file that exists but is not a property-list
// dictionary is moved aside, so it is neither lost nor overwritten.
Dictionary readPreferenceFile(const std::string& path, std::vector<std::string>& problems) {
  std::ifstream in(path, std::ios::binary);
  if (!in) return {};
  Bytes bytes((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
  if (bytes.empty()) return {};
  std::optional<Value> root = plist::parse(bytes);
  if (root && root->isDictionary()) return root->dictionary();
  std::string aside = path + ".corrupt";
  if (std::rename(path.c_str(), aside.c_str()) == 0) {
    problems.push_back(
        format("Preference file %@ is not a property list; moved it to %@ and started empty",
               path, aside));
  } else {
    problems.push_back(format("Preference file %@ is not a property list and cannot be moved "
                              "aside (%@); reading it as empty",
                              path, std::strerror(errno)));
  }
  return {};
}

void report(const std::vector<std::string>& problems) {
  for (const std::string& p : problems) VTC_LOG_ERROR("%@", p);
}

}  // namespace

PreferenceStore& PreferenceStore::shared() {
  static PreferenceStore* store = new PreferenceStore();  // never destroyed: used at exit
  return *store;
}

std::string PreferenceStore::pathOf(const Key& key) {
  return key.second == Scope::CurrentHost ? perHostFile(key.first) : perUserFile(key.first);
}

PreferenceStore::Domain& PreferenceStore::load(const Key& key,
                                                std::vector<std::string>& problems) {
  Domain& d = domains_[key];
  if (!d.loaded) {
    std::string path = pathOf(key);
    FileLock lock(path);
    d.values = readPreferenceFile(path, problems);
    d.loaded = true;
  }
  return d;
}

Value PreferenceStore::copyValue(std::string_view key, std::string_view domain, Scope scope) {
  std::vector<std::string> problems;
  Value v;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    v = load({std::string(domain), scope}, problems).values.get(key);
  }
  report(problems);  // outside the lock: logging may read preferences itself
  return v;
}

void PreferenceStore::setValue(std::string_view key, Value value, std::string_view domain,
                               Scope scope) {
  Dictionary sets;
  std::vector<std::string> removals;
  if (value.isNone()) removals.emplace_back(key);
  else sets.set(std::string(key), std::move(value));
  setMultiple(sets, removals, domain, scope);
}

std::vector<std::string> PreferenceStore::copyKeyList(std::string_view domain, Scope scope) {
  std::vector<std::string> problems;
  std::vector<std::string> keys;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    keys = load({std::string(domain), scope}, problems).values.keys();
  }
  report(problems);
  return keys;
}

Dictionary PreferenceStore::copyMultiple(const std::vector<std::string>& keys,
                                         std::string_view domain, Scope scope) {
  std::vector<std::string> problems;
  Dictionary out;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    const Dictionary& values = load({std::string(domain), scope}, problems).values;
    if (keys.empty()) {
      out = values;
    } else {
      for (const std::string& k : keys)
        if (const Value* v = values.find(k)) out.set(k, *v);
    }
  }
  report(problems);
  return out;
}

void PreferenceStore::setMultiple(const Dictionary& values,
                                  const std::vector<std::string>& removals,
                                  std::string_view domain, Scope scope) {
  std::vector<std::string> problems;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    Domain& d = load({std::string(domain), scope}, problems);
    for (const std::string& k : removals) {
      d.values.erase(k);
      d.pendingSets.erase(k);
      d.pendingRemovals.insert(k);
    }
    for (const auto& [k, v] : values) {
      d.values.set(k, v);
      d.pendingSets.set(k, v);
      d.pendingRemovals.erase(k);
    }
  }
  report(problems);
}

bool PreferenceStore::synchronize(std::string_view domain, Scope scope) {
  std::vector<std::string> problems;
  bool ok = true;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    Key key{std::string(domain), scope};
    Domain& d = load(key, problems);
    std::string path = pathOf(key);
    paths::makeDirectories(path.substr(0, path.find_last_of('/')), 0700);
    FileLock fileLock(path);
    Dictionary onDisk = readPreferenceFile(path, problems);
    if (!d.pendingSets.empty() || !d.pendingRemovals.empty()) {
      for (const std::string& k : d.pendingRemovals) onDisk.erase(k);
      onDisk.merge(d.pendingSets);
      ok = plist::writeFileAtomically(path, Value(onDisk), 0600);
      if (ok) {
        d.pendingSets.clear();
        d.pendingRemovals.clear();
      } else {
        problems.push_back(format("Could not write preference file %@", path));
      }
    }
    if (ok) d.values = std::move(onDisk);
  }
  report(problems);
  return ok;
}

Value PreferenceStore::copyAppValue(std::string_view key, std::string_view domain) {
  Value v = copyValue(key, domain, Scope::CurrentHost);
  if (!v.isNone()) return v;
  return copyValue(key, domain, Scope::AnyHost);
}

void PreferenceStore::resetForTesting() {
  std::lock_guard<std::mutex> lock(mutex_);
  domains_.clear();
}

}  // namespace vtc::prefs
