// Where message-trace records go. By default the system journal; tests and
// hosts without a journal install a sink that receives the same fields.
#pragma once

#include <functional>
#include <string>
#include <utility>
#include <vector>

namespace vtc {

// One record: the journal fields in the order they were set, e.g.
// ("COM_KORVO_MESSAGE_DOMAIN", "..."), then ("MESSAGE", text).
using MessageTraceRecord = std::vector<std::pair<std::string, std::string>>;

// Returns 0 on success or a negative errno, as the journal does.
using MessageTraceSink = std::function<int(const MessageTraceRecord&)>;

// nullptr-equivalent (an empty function) restores the journal.
void installMessageTraceSink(MessageTraceSink sink);

// The journal field name of a record key: upper-cased, "." turned into "_".
std::string journalFieldName(const std::string& key);

}  // namespace vtc
