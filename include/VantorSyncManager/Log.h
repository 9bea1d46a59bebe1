// The library's text log, "~/Library/Logs/Sync/nubilosync.log". One line per
// call, written with one append-mode write, so lines of several threads and
// processes interleave whole. Logging never fails its caller.
#pragma once

#include "VantorSyncManager/Export.h"

extern "C" {

// Writes one line when `level` (0 Error, 1 Warning, 2 Info, 3 Debug) is not
// above the configured level. `format` takes printf conversions and "%@",
// which here takes a UTF-8 `const char*`.
VSM_EXPORT void _VTCLog(const char* file, int line, const char* function, int level,
                        const char* format, ...);

// Reads the configured level and rolls the log once per process; _VTCLog
// calls it first, a host may call it early to roll the log at start-up.
VSM_EXPORT void initVTCLogger(void);

}  // extern "C"
