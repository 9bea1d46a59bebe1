// NubiloMappedChangelog: a large changelog kept in a mapped temporary file
// until it is first looked at.
#include <fcntl.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

#include <stdexcept>

#include "VantorSyncManager/NubiloChangeLog.h"
#include "common/Logging.h"
#include "common/Uuid.h"
#include "platform/fs/LocalPaths.h"

// The held bytes: a read-only mapping of the file, or a copy in memory.
struct NubiloMappedChangelog::Mapping {
  void* address = MAP_FAILED;
  size_t length = 0;
  vtc::Bytes copy;

  vtc::ByteView bytes() const {
    if (address != MAP_FAILED) return vtc::ByteView(static_cast<const uint8_t*>(address), length);
    return copy;
  }
  ~Mapping() {
    if (address != MAP_FAILED) ::munmap(address, length);
  }
  static std::unique_ptr<Mapping> ofFile(const std::string& path) {
    int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
    if (fd < 0) return nullptr;
    struct stat st {};
    auto m = std::make_unique<Mapping>();
    if (::fstat(fd, &st) == 0 && st.st_size > 0) {
      m->length = static_cast<size_t>(st.st_size);
      m->address = ::mmap(nullptr, m->length, PROT_READ, MAP_PRIVATE, fd, 0);
    }
    ::close(fd);
    if (m->address == MAP_FAILED) return nullptr;
    return m;
  }
};

namespace {

bool writeWhole(const std::string& path, vtc::ByteView data) {
  std::string tmp = path + ".partial";
  int fd = ::open(tmp.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
  if (fd < 0) return false;
  size_t done = 0;
  while (done < data.size()) {
    ssize_t n = ::write(fd, data.data() + done, data.size() - done);
    if (n <= 0) break;
    done += static_cast<size_t>(n);
  }
  bool ok = ::close(fd) == 0 && done == data.size();
  if (ok && ::rename(tmp.c_str(), path.c_str()) == 0) return true;
  ::unlink(tmp.c_str());
  return false;
}

}  // namespace

NubiloMappedChangelog::NubiloMappedChangelog(vtc::ByteView data) {
  _mappedFile = vtc::paths::join(vtc::paths::temporaryDirectory(), vtc::makeUUIDString());
  if (writeWhole(_mappedFile, data)) _mappedData = Mapping::ofFile(_mappedFile);
  if (!_mappedData) {
    VTC_LOG_WARNING(
        "Failed to write temporary changelog data to %@ for memory mapping, keeping data in "
        "memory instead",
        _mappedFile);
    _mappedData = std::make_unique<Mapping>();
    _mappedData->copy.assign(data.begin(), data.end());
  }
}

std::unique_ptr<NubiloMappedChangelog> NubiloMappedChangelog::adoptingFile(
    const std::string& path) {
  std::unique_ptr<NubiloMappedChangelog> log(new NubiloMappedChangelog());
  log->_mappedFile = path;
  log->_mappedData = Mapping::ofFile(path);
  if (!log->_mappedData) throw std::invalid_argument("Cannot map changelog file " + path);
  return log;
}

NubiloMappedChangelog::~NubiloMappedChangelog() {
  release();
}

void NubiloMappedChangelog::release() {
  if (!_mappedData) return;
  _mappedData.reset();
  ::unlink(_mappedFile.c_str());  // a file already gone needs no deleting
  _mappedFile.clear();
}

void NubiloMappedChangelog::parseData() {
  if (!_mappedData) return;
  NubiloChangeLog::parseData(_mappedData->bytes());  // a failure leaves it mapped
  release();
}

void NubiloMappedChangelog::inputConsumed(const uint8_t* begin, const uint8_t* end) {
  if (!_mappedData || _mappedData->address == MAP_FAILED) return;  // only mapped pages
  const auto page = static_cast<uintptr_t>(::sysconf(_SC_PAGESIZE));
  auto first = (reinterpret_cast<uintptr_t>(begin) + page - 1) & ~(page - 1);
  auto last = reinterpret_cast<uintptr_t>(end) & ~(page - 1);
  // Clean private pages of a file: dropping them only costs a re-read.
  if (last > first) ::madvise(reinterpret_cast<void*>(first), last - first, MADV_DONTNEED);
}

void NubiloMappedChangelog::dumpToTextFile(const std::string& path, bool includingSummary) {
  parseData();
  NubiloChangeLog::dumpToTextFile(path, includingSummary);
}

void NubiloMappedChangelog::printChangeLog() {
  parseData();
  NubiloChangeLog::printChangeLog();
}

std::optional<vtc::Array> NubiloMappedChangelog::getSchemaVersions() {
  parseData();
  return NubiloChangeLog::getSchemaVersions();
}

const vtc::Dictionary& NubiloMappedChangelog::headers() {
  parseData();
  return NubiloChangeLog::headers();
}

const std::vector<SyncEngineChange>& NubiloMappedChangelog::changes() {
  parseData();
  return NubiloChangeLog::changes();
}

vtc::Value NubiloMappedChangelog::headerValueForKey(const std::string& key) {
  parseData();
  return NubiloChangeLog::headerValueForKey(key);
}

void NubiloMappedChangelog::writeToData(vtc::Bytes& output) {
  if (_mappedData) {
    vtc::ByteView held = _mappedData->bytes();  // as downloaded, not re-encoded
    output.assign(held.begin(), held.end());
    return;
  }
  NubiloChangeLog::writeToData(output);
}

void NubiloMappedChangelog::setSchemaVersions(const vtc::Array&) {
  throw std::invalid_argument("Cannot setSchemaVersions on a memory mapped Changelog");
}

void NubiloMappedChangelog::setHeaderValue(const vtc::Value&, const std::string&) {
  throw std::invalid_argument("Cannot setHeaderValue on a memory mapped Changelog");
}
