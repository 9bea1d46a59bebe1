// The library's one assertion handler. A failed assertion (a member that must
// no longer be used, a required argument that is missing) writes one Error
// line to the log naming the class, the member, the source file and the line,
// then follows the process-wide policy: throw vtc::AssertionFailure (the
// default), or carry on, in which case the member returns its fixed or
// neutral value. The policy may be changed from any thread.
#pragma once

#include <stdexcept>
#include <string>

#include "VantorSyncManager/Export.h"

namespace vtc {

class VSM_EXPORT AssertionFailure : public std::logic_error {
 public:
  AssertionFailure(std::string className, std::string member, std::string file, int line,
                   const std::string& description);

  const std::string& className() const { return className_; }
  const std::string& member() const { return member_; }
  // The source file's name, without its folders.
  const std::string& file() const { return file_; }
  int line() const { return line_; }
  // The assertion's own text; what() is the same.
  std::string description() const { return what(); }

 private:
  std::string className_;
  std::string member_;
  std::string file_;
  int line_;
};

enum class AssertionPolicy { Throw, Continue };

VSM_EXPORT void setAssertionPolicy(AssertionPolicy policy);
VSM_EXPORT AssertionPolicy assertionPolicy();

}  // namespace vtc
