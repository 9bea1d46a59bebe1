#include "common/MessageTrace.h"

#include <sys/uio.h>
#include <systemd/sd-journal.h>

#include <cctype>
#include <cstdio>

#include "VantorSyncManager/Diagnostics.h"
#include "common/Seam.h"

namespace vtc {

namespace {

Seam<int(const MessageTraceRecord&)> gSink;

int sendToJournal(const MessageTraceRecord& record) {
  std::vector<std::string> lines;
  lines.reserve(record.size());
  for (const auto& [field, value] : record) lines.push_back(field + "=" + value);
  std::vector<iovec> iov;
  iov.reserve(lines.size());
  for (std::string& line : lines) iov.push_back({line.data(), line.size()});
  return sd_journal_sendv(iov.data(), static_cast<int>(iov.size()));
}

}  // namespace

void installMessageTraceSink(MessageTraceSink sink) { gSink.install(std::move(sink)); }

std::string journalFieldName(const std::string& key) {
  std::string out;
  out.reserve(key.size());
  for (char c : key)
    out += c == '.' ? '_' : static_cast<char>(std::toupper(static_cast<unsigned char>(c)));
  return out;
}

}  // namespace vtc

extern "C" VSM_EXPORT void VTCMessageTrace(const char* domain, const char* signature,
                                           const char* signature2, const char* signature3,
                                           const char* result, const char* uuid, const char* value,
                                           const char* value2, const char* message,
                                           const char* event) {
  // The record's keys in the order they are set. Domain and signature are
  // always set: a null one fails the chain and nothing is logged.
  struct Field {
    const char* key;
    const char* value;
    bool required;
  };
  const Field fields[] = {
      {"com.korvo.message.domain", domain, true},
      {"com.korvo.message.signature", signature, true},
      {"com.korvo.message.result", result, false},
      {"com.korvo.message.signature2", signature2, false},
      {"com.korvo.message.signature3", signature3, false},
      {"com.korvo.message.uuid", uuid, false},
      {"com.korvo.message.value", value, false},
      {"com.korvo.message.value2", value2, false},
      {"com.korvo.message.event", event, false},
  };
  vtc::MessageTraceRecord record;
  int status = 0;
  for (const Field& f : fields) {
    if (!f.value) {
      if (f.required) {
        status = -22;  // EINVAL: the key cannot be set without a value
        break;
      }
      continue;
    }
    record.emplace_back(vtc::journalFieldName(f.key), f.value);
  }
  if (status == 0) {
    record.emplace_back("PRIORITY", "6");
    record.emplace_back("MESSAGE", message ? message : "");
    auto sink = vtc::gSink.current();
    status = sink ? sink(record) : vtc::sendToJournal(record);
  }
  if (status != 0) std::fprintf(stderr, "asl_log() or its precursors failed: %d\n", status);
}
