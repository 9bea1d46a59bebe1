// Passwords in memory: the process is not dumpable while it holds one (no
// core file, no reading of its memory by other processes of the user), and
// a password buffer is overwritten when it is let go.
#pragma once

#include <string>

namespace vtc {

// While any hold lives, the process is not dumpable; when the last one
// goes, the process is as dumpable as it was before the first.
class SecretHold {
 public:
  SecretHold();
  SecretHold(const SecretHold&);
  SecretHold& operator=(const SecretHold&) { return *this; }
  ~SecretHold();
};

// Whether the process may be dumped now (PR_GET_DUMPABLE).
bool processIsDumpable();

// Overwrites the text's characters, its whole buffer, then empties it.
void wipe(std::string& text);

}  // namespace vtc
