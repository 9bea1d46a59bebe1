// How far a sync has come, told as it goes: the command line draws it on a
// terminal and ignores it elsewhere.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>

namespace vtc::client {

class Progress {
 public:
  virtual ~Progress() = default;
  // One step of a dataclass's sync ("reading the folder", "receiving",
  // "taking in changes", "sending", "writing files"): done of total (total 0:
  // unknown), and the bytes moved so far in it.
  virtual void step(const std::string& dataclass, const char* what, size_t done, size_t total,
                    int64_t bytes) = 0;
  // The dataclass is done; whatever was drawn for it goes.
  virtual void done(const std::string& dataclass) = 0;
};

}  // namespace vtc::client
