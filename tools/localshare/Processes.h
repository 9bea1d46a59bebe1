// Starting and stopping the servers that fixtures run, and reaching them on
// 127.0.0.1.
#pragma once

#include <sys/types.h>

#include <functional>
#include <string>
#include <vector>

namespace vtc::local {

// Starts argv[0] (looked up in PATH) with `input` on its standard input and
// its output discarded; it dies with the test process.
pid_t startProcess(const std::vector<std::string>& argv, const std::string& input = {});
// SIGTERM to its process group, a few seconds to exit, then SIGKILL; pid
// becomes -1.
void stopProcess(pid_t& pid);
// Polls every 10 ms until ready() holds (true) or ten seconds pass (false).
bool waitUntil(const std::function<bool()>& ready);

// A socket connected to port on 127.0.0.1, or -1 when nothing listens there.
int connectLoopback(int port);
// A socket listening on a free port of 127.0.0.1; port receives the number.
int listenLoopback(int& port);

}  // namespace vtc::local
