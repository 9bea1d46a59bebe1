// Reading WebDAV multistatus answers and lock discovery from an XmlElement
// tree, and writing PROPFIND bodies.
#pragma once

#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "VantorSyncManager/Value.h"
#include "platform/dav/XmlTree.h"

namespace vtc {

struct PropfindEntry {
  std::string href;       // the href as the server sent it
  std::string path;       // unescaped path of the href
  Dictionary properties;  // full property name -> text (2xx propstats only)
  const XmlElement* lockDiscovery = nullptr;
};

// The responses of a DAV:multistatus root, in document order.
std::vector<PropfindEntry> readMultistatus(const XmlElement& root);

// Splits a full property name into namespace and local name: "DAV:getetag"
// gives ("DAV:", "getetag"); otherwise the cut is after the last '/', '#' or
// ':'.
std::pair<std::string, std::string> splitPropertyName(std::string_view fullName);

// A PROPFIND body asking for the named properties, or for all of them.
std::string propfindBody(const std::vector<std::string>& fullNames);

// The active locks of a DAV:lockdiscovery element, as dictionaries.
Array readActiveLocks(const XmlElement& lockDiscovery);

// The fields of a sync lock owner record in an owner text ("lock-user",
// "clientid", ...): one element with text children. Empty when the text is
// no such record.
Dictionary ownerFields(std::string_view ownerXml);

}  // namespace vtc
