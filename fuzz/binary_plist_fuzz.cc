// Feeds arbitrary bytes to the binary property-list reader. Anything it
// accepts must survive writing and reading again unchanged, and no input
// may crash it, hang it or make it read outside the bytes.
#include <cstdlib>

#include "platform/plist/BinaryPlistReader.h"
#include "platform/plist/BinaryPlistWriter.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  std::optional<vtc::Value> value = vtc::plist::parseBinary(vtc::ByteView(data, size));
  if (!value) return 0;
  vtc::plist::BinaryPlistWriter writer;
  vtc::Bytes once, twice;
  writer.append(*value, once);
  if (value->isNone()) {
    if (!once.empty()) std::abort();  // a none value has no document
    return 0;
  }
  std::optional<vtc::Value> again = vtc::plist::parseBinary(once);
  if (!again) std::abort();
  writer.append(*again, twice);
  if (once != twice) std::abort();  // compared as bytes: NaN reals are not equal to themselves
  return 0;
}
