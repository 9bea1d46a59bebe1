#include <atomic>
#include <cstring>

#include "common/Assertions.h"
#include "common/Logging.h"

namespace vtc {

namespace {

std::atomic<AssertionPolicy> policy{AssertionPolicy::Throw};

std::string lastPathComponent(const char* file) {
  if (!file) return "";
  const char* slash = std::strrchr(file, '/');
  return slash ? slash + 1 : file;
}

}  // namespace

AssertionFailure::AssertionFailure(std::string className, std::string member, std::string file,
                                   int line, const std::string& description)
    : std::logic_error(description),
      className_(std::move(className)),
      member_(std::move(member)),
      file_(std::move(file)),
      line_(line) {}

void setAssertionPolicy(AssertionPolicy p) {
  policy = p;
}

AssertionPolicy assertionPolicy() {
  return policy;
}

void handleAssertionFailure(const char* className, const char* member, const char* file, int line,
                            const char* function, const std::string& description) {
  std::string fileName = lastPathComponent(file);
  if (log::wants(log::kError))
    log::writeLine(file, line, function, log::kError,
                   format("Assertion failure in %@::%@, %@:%d: %@", className, member, fileName,
                          line, description));
  if (policy == AssertionPolicy::Throw)
    throw AssertionFailure(className, member, fileName, line, description);
}

}  // namespace vtc
