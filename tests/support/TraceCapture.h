// Captures message-trace records in memory for the life of the object.
#pragma once

#include <mutex>
#include <string>
#include <vector>

#include "common/MessageTrace.h"

namespace vtc::test {

class TraceCapture {
 public:
  TraceCapture();
  ~TraceCapture();
  std::vector<MessageTraceRecord> records() const;
  // The records whose domain field equals domain.
  std::vector<MessageTraceRecord> withDomain(const std::string& domain) const;
  static std::string field(const MessageTraceRecord& record, const std::string& key);

 private:
  mutable std::mutex mutex_;
  std::vector<MessageTraceRecord> records_;
};

}  // namespace vtc::test
