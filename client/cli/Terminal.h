// Reading a password: from the terminal without echo, or the first line of
// standard input when it is not a terminal.
#pragma once

#include <optional>
#include <string>

namespace vtc::client {

// Prompts on standard error when standard input is a terminal. None when
// nothing could be read.
std::optional<std::string> readPassword(const std::string& prompt);

}  // namespace vtc::client
