#include "changelog/ChangeLogFileWriter.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <stdexcept>

#include "VantorSyncManager/NubiloChangeLog.h"
#include "VantorSyncManager/NubiloDataAdditions.h"
#include "changelog/ChangeLogFormat.h"
#include "common/Uuid.h"
#include "platform/fs/LocalPaths.h"

namespace vtc::clog {

namespace {

constexpr uint8_t kGzipHeader[] = {0x1F, 0x8B, 0x08, 0, 0, 0, 0, 0, 0, 0x03};

[[noreturn]] void failed(const std::string& what, const std::string& path) {
  throw std::runtime_error("Cannot write the changelog " + path + " (" + what +
                           "): " + std::strerror(errno));
}

void writeAll(int fd, const uint8_t* data, size_t size, const std::string& path) {
  while (size > 0) {
    const ssize_t n = ::write(fd, data, size);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) failed("writing", path);
    data += n;
    size -= static_cast<size_t>(n);
  }
}

void putUInt32(Bytes& out, size_t offset, uint32_t v) {
  out[offset] = static_cast<uint8_t>(v >> 24);
  out[offset + 1] = static_cast<uint8_t>(v >> 16);
  out[offset + 2] = static_cast<uint8_t>(v >> 8);
  out[offset + 3] = static_cast<uint8_t>(v);
}

}  // namespace

ChangeLogFileWriter::ChangeLogFileWriter(const std::string& folder)
    : bodyPath_(paths::join(folder, ".changelog-body-" + makeUUIDString())) {
  bodyFd_ = ::open(bodyPath_.c_str(), O_RDWR | O_CREAT | O_EXCL | O_CLOEXEC, 0600);
  if (bodyFd_ < 0) failed("making its body file", bodyPath_);
  if (deflateInit2(&z_, Z_DEFAULT_COMPRESSION, Z_DEFLATED, -15, 8, Z_DEFAULT_STRATEGY) != Z_OK) {
    ::close(bodyFd_);
    ::unlink(bodyPath_.c_str());
    throw std::runtime_error("Cannot start compressing a changelog");
  }
  writeAll(bodyFd_, kGzipHeader, sizeof kGzipHeader, bodyPath_);
  // The creator headers, as a changelog made from changes has them.
  headers_ = NubiloChangeLog(std::vector<SyncEngineChange>{}).headers();
}

ChangeLogFileWriter::~ChangeLogFileWriter() {
  if (!finished_) deflateEnd(&z_);
  if (bodyFd_ >= 0) ::close(bodyFd_);
  ::unlink(bodyPath_.c_str());
}

void ChangeLogFileWriter::setHeaderValue(const Value& value, const std::string& key) {
  if (value.isNone() || key.empty()) return;
  headers_.set(key, value);
}

void ChangeLogFileWriter::setSchemaVersions(const Array& versions) {
  NubiloChangeLog holder(std::vector<SyncEngineChange>{});
  holder.setSchemaVersions(versions);
  for (const auto& [key, value] : holder.headers())
    if (key.ends_with(".Version")) headers_.set(key, value);
}

void ChangeLogFileWriter::deflateOut(const uint8_t* data, size_t size, int flush) {
  uint8_t out[64 << 10];
  z_.next_in = const_cast<Bytef*>(data);
  z_.avail_in = static_cast<uInt>(size);
  int ret;
  do {
    z_.next_out = out;
    z_.avail_out = sizeof out;
    ret = deflate(&z_, flush);
    if (ret == Z_STREAM_ERROR) throw std::runtime_error("Compressing a changelog failed");
    writeAll(bodyFd_, out, sizeof out - z_.avail_out, bodyPath_);
  } while (z_.avail_out == 0 || (flush == Z_FINISH && ret != Z_STREAM_END));
}

void ChangeLogFileWriter::append(const SyncEngineChange& change) {
  if (finished_) throw std::logic_error("Changes appended to a finished changelog");
  record_.clear();
  NubiloAppendString(record_, textWithoutZero(change.recordIdentifier(), "record identifier"));
  NubiloAppendUInt32(record_, change.type());
  const size_t lengthAt = record_.size();
  NubiloAppendUInt32(record_, 0);
  archiver_.append(change.changes(), record_);  // refuses nesting readers refuse
  putUInt32(record_, lengthAt, static_cast<uint32_t>(record_.size() - lengthAt - 4));
  offsets_.push_back(static_cast<uint32_t>(bodySize_));
  bodySize_ += record_.size();
  deflateOut(record_.data(), record_.size(), Z_NO_FLUSH);
}

void ChangeLogFileWriter::finish(const std::string& path) {
  if (finished_) throw std::logic_error("A changelog finished twice");
  deflateOut(nullptr, 0, Z_FINISH);
  deflateEnd(&z_);
  finished_ = true;

  headers_.set("CreationTimestamp", Value(creationTimestamp()));
  const std::vector<std::string> lines = headerLines(headers_);
  const size_t n = offsets_.size();
  Bytes front(12 + 4 * n, 0);
  putUInt32(front, 0, kFormatNumber);
  putUInt32(front, 4, static_cast<uint32_t>(12 + 4 * n));
  for (const std::string& line : lines) NubiloAppendString(front, line);
  NubiloAppendString(front, kHeaderEnd);
  const size_t bodyStart = front.size();
  for (size_t i = 0; i < n; ++i)
    putUInt32(front, 8 + 4 * i, static_cast<uint32_t>(bodyStart + offsets_[i]));
  putUInt32(front, 8 + 4 * n, kIndexEnd);

  const int fd = ::open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
  if (fd < 0) failed("making it", path);
  try {
    writeAll(fd, front.data(), front.size(), path);
    if (::lseek(bodyFd_, 0, SEEK_SET) != 0) failed("rereading its body", bodyPath_);
    uint8_t buffer[64 << 10];
    for (;;) {
      const ssize_t got = ::read(bodyFd_, buffer, sizeof buffer);
      if (got < 0 && errno == EINTR) continue;
      if (got < 0) failed("rereading its body", bodyPath_);
      if (got == 0) break;
      writeAll(fd, buffer, static_cast<size_t>(got), path);
    }
  } catch (...) {
    ::close(fd);
    throw;
  }
  if (::close(fd) != 0) failed("closing it", path);
}

}  // namespace vtc::clog
