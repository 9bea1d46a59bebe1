#include "support/TraceCapture.h"

namespace vtc::test {

TraceCapture::TraceCapture() {
  installMessageTraceSink([this](const MessageTraceRecord& r) {
    std::lock_guard<std::mutex> lock(mutex_);
    records_.push_back(r);
    return 0;
  });
}

TraceCapture::~TraceCapture() {
  installMessageTraceSink({});
}

std::vector<MessageTraceRecord> TraceCapture::records() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return records_;
}

std::vector<MessageTraceRecord> TraceCapture::withDomain(const std::string& domain) const {
  auto all = records();
  std::erase_if(all, [&](const auto& r) { return field(r, "COM_KORVO_MESSAGE_DOMAIN") != domain; });
  return all;
}

std::string TraceCapture::field(const MessageTraceRecord& record, const std::string& key) {
  for (const auto& [k, v] : record)
    if (k == key) return v;
  return {};
}

}  // namespace vtc::test
