// Stopping the servers that fixtures start, by PID.
#pragma once

#include <sys/types.h>

namespace vtc::test {

// SIGTERM, a few seconds to exit, then SIGKILL; pid becomes -1.
void stopProcess(pid_t& pid);

}  // namespace vtc::test
