// Feeds arbitrary bytes to the property-list reader's XML path (libplist
// behind a depth check, then the conversion to values). Nothing may crash,
// hang or exhaust the stack; a document it accepts is written as XML and
// must read back as the same value.
#include <cstdlib>
#include <string>

#include "platform/plist/PlistCodec.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  std::optional<vtc::Value> value = vtc::plist::parse(vtc::ByteView(data, size));
  if (!value || value->isNone()) return 0;
  const std::string xml = vtc::plist::toXml(*value);
  if (xml.empty()) return 0;  // nothing a property list can hold (a top-level none)
  const auto* bytes = reinterpret_cast<const uint8_t*>(xml.data());
  std::optional<vtc::Value> again = vtc::plist::parse(vtc::ByteView(bytes, xml.size()));
  if (!again) std::abort();
  if (vtc::plist::toXml(*again) != xml) std::abort();  // as text: NaN is not equal to itself
  return 0;
}
