// Diagnostics beside the text log: structured message-trace records in the
// system journal, the statistics file, and the internal-network test.
#pragma once

#include "VantorSyncManager/Export.h"
#include "VantorSyncManager/Value.h"

extern "C" {

// Writes one structured record (informational priority) whose fields are
// the non-null arguments; the message text is the record's text. Never
// fails its caller: failures go to standard error.
VSM_EXPORT void VTCMessageTrace(const char* domain, const char* signature, const char* signature2,
                                const char* signature3, const char* result, const char* uuid,
                                const char* value, const char* value2, const char* message,
                                const char* event);

// Whether this computer has an IPv4 address on the maker's internal network.
VSM_EXPORT bool isKorvoInternal(void);

}  // extern "C"

// Merges the entries into "~/Library/Logs/Sync/nubilosyncstats.plist" and
// writes it back atomically; false when the write failed.
VSM_EXPORT bool VTCLogStatistics(const vtc::Dictionary& statistics);
