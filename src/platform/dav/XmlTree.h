// A small element tree built from a response body by neon's XML parser, so
// that multistatus answers are read whole (no length cut on property values).
#pragma once

#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include <ne_xml.h>

namespace vtc {

struct XmlElement {
  std::string ns;  // namespace URI, "" when none
  std::string name;
  std::string text;  // character data directly inside this element
  std::vector<std::unique_ptr<XmlElement>> children;

  const XmlElement* child(std::string_view ns, std::string_view name) const;
  std::vector<const XmlElement*> childrenNamed(std::string_view ns, std::string_view name) const;
  // The text of this element and all its descendants, in document order.
  std::string allText() const;
  // The element's children serialised as XML, namespaces declared inline.
  std::string innerXml() const;
};

// Collects every element of a document into a tree. Push it onto a parser
// before the parser sees the document; root() is valid afterwards. A
// document nested deeper than kMaxDepth, or holding more elements than its
// answer's size cap allows (each element costs a hundred bytes or more
// here, from as few as four of XML), is refused with a sentence as the
// parser's error.
class XmlTreeBuilder {
 public:
  static constexpr size_t kMaxDepth = 64;
  // Bytes of the answer cap per element allowed, and the fewest allowed.
  static constexpr size_t kBytesPerElement = 64;
  static constexpr size_t kFewestElements = 65536;

  explicit XmlTreeBuilder(ne_xml_parser* parser);
  const XmlElement* root() const { return root_.get(); }

 private:
  static int startElement(void* userdata, int parent, const char* nspace, const char* name,
                          const char** atts);
  static int characters(void* userdata, int state, const char* cdata, size_t len);
  static int endElement(void* userdata, int state, const char* nspace, const char* name);

  ne_xml_parser* parser_;
  size_t elementsLeft_;
  std::unique_ptr<XmlElement> root_;
  std::vector<XmlElement*> stack_;
};

// The text with "&", "<", ">" and the double quote replaced by their XML
// entities (ampersand first), for content and double-quoted attributes; the
// apostrophe is left as it is.
std::string xmlEscape(std::string_view text);

}  // namespace vtc
