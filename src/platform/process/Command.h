// Running other programs: a command that is waited for with its output
// captured, and a child that is started now and collected later. Programs
// are looked up in PATH; arguments go straight to execvp, never through a
// shell.
#pragma once

#include <sys/types.h>

#include <optional>
#include <string>
#include <vector>

namespace vtc::process {

struct CommandResult {
  // The exit status; 127 when the program could not be started, 128 plus
  // the signal number when a signal ended it.
  int status = 127;
  std::string out;
  std::string err;
};

// Runs argv with input on its standard input and waits for it.
CommandResult run(const std::vector<std::string>& argv, const std::string& input = {});

// Starts argv with standard input from /dev/null and the caller's standard
// output and error; -1 when it could not be forked.
pid_t spawn(const std::vector<std::string>& argv);

// The exit status of a child started by spawn() (as CommandResult::status),
// or nothing while it still runs (wait false).
std::optional<int> collect(pid_t pid, bool wait);

}  // namespace vtc::process
