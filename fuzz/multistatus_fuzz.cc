// Feeds arbitrary bytes, as a server's answer, to the multistatus reader:
// neon's XML parser building the element tree within its depth and element
// caps, then the responses, their properties, lock discovery and lock owner
// records read from it. Nothing may crash, hang or read out of bounds.
#include <ne_xml.h>

#include <string>

#include "platform/dav/DavMultistatus.h"
#include "platform/dav/XmlTree.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  ne_xml_parser* parser = ne_xml_create();
  {
    vtc::XmlTreeBuilder builder(parser);
    const auto* text = reinterpret_cast<const char*>(data);
    // Fed in two parts, as an answer arrives in blocks.
    const size_t half = size / 2;
    if (ne_xml_parse(parser, text, half) == 0 &&
        ne_xml_parse(parser, text + half, size - half) == 0 && ne_xml_parse(parser, "", 0) == 0 &&
        !ne_xml_failed(parser) && builder.root()) {
      for (const vtc::PropfindEntry& entry : vtc::readMultistatus(*builder.root())) {
        if (entry.lockDiscovery)
          for (const vtc::Value& lock : vtc::readActiveLocks(*entry.lockDiscovery))
            vtc::ownerFields(lock.dictionary().get("owner").string());
        vtc::splitPropertyName(entry.href);
      }
    }
  }
  ne_xml_destroy(parser);
  return 0;
}
