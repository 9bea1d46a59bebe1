#include "platform/dav/XmlTree.h"

#include <algorithm>

#include "common/Format.h"
#include "common/Limits.h"

namespace vtc {

const XmlElement* XmlElement::child(std::string_view n, std::string_view local) const {
  for (const auto& c : children)
    if (c->ns == n && c->name == local) return c.get();
  return nullptr;
}

std::vector<const XmlElement*> XmlElement::childrenNamed(std::string_view n,
                                                         std::string_view local) const {
  std::vector<const XmlElement*> out;
  for (const auto& c : children)
    if (c->ns == n && c->name == local) out.push_back(c.get());
  return out;
}

std::string XmlElement::allText() const {
  std::string out = text;
  for (const auto& c : children) out += c->allText();
  return out;
}

std::string XmlElement::innerXml() const {
  std::string out = xmlEscape(text);
  for (const auto& c : children) {
    out += "<" + c->name;
    if (!c->ns.empty()) out += " xmlns=\"" + xmlEscape(c->ns) + "\"";
    std::string inner = c->innerXml();
    if (inner.empty()) {
      out += "/>";
    } else {
      out += ">" + inner + "</" + c->name + ">";
    }
  }
  return out;
}

XmlTreeBuilder::XmlTreeBuilder(ne_xml_parser* parser)
    : parser_(parser),
      elementsLeft_(std::max<size_t>(kFewestElements, limits().answerBytes / kBytesPerElement)) {
  ne_xml_push_handler(parser, startElement, characters, endElement, this);
}

int XmlTreeBuilder::startElement(void* userdata, int, const char* nspace, const char* name,
                                 const char**) {
  auto* self = static_cast<XmlTreeBuilder*>(userdata);
  // No answer of ours nests deeply; a server that does is refused rather
  // than allowed to exhaust the stack of the recursive readers.
  if (self->stack_.size() >= kMaxDepth) {
    ne_xml_set_error(self->parser_, "the answer's XML nests too deep");
    return NE_XML_ABORT;
  }
  if (self->elementsLeft_ == 0) {
    const size_t allowed =
        std::max<size_t>(kFewestElements, limits().answerBytes / kBytesPerElement);
    ne_xml_set_error(self->parser_,
                     format("The answer holds more than %d XML elements (the limit %@)", allowed,
                            Limits::kAnswerKey)
                         .c_str());
    return NE_XML_ABORT;
  }
  --self->elementsLeft_;
  auto element = std::make_unique<XmlElement>();
  element->ns = nspace ? nspace : "";
  element->name = name ? name : "";
  XmlElement* raw = element.get();
  if (self->stack_.empty()) {
    if (self->root_) return NE_XML_DECLINE;  // a second root cannot happen in XML
    self->root_ = std::move(element);
  } else {
    self->stack_.back()->children.push_back(std::move(element));
  }
  self->stack_.push_back(raw);
  return 1;
}

int XmlTreeBuilder::characters(void* userdata, int, const char* cdata, size_t len) {
  auto* self = static_cast<XmlTreeBuilder*>(userdata);
  if (!self->stack_.empty()) self->stack_.back()->text.append(cdata, len);
  return 0;
}

int XmlTreeBuilder::endElement(void* userdata, int, const char*, const char*) {
  auto* self = static_cast<XmlTreeBuilder*>(userdata);
  if (!self->stack_.empty()) self->stack_.pop_back();
  return 0;
}

std::string xmlEscape(std::string_view text) {
  std::string out;
  out.reserve(text.size() + 16);
  for (char c : text) {
    switch (c) {
      case '&':
        out += "&amp;";
        break;
      case '<':
        out += "&lt;";
        break;
      case '>':
        out += "&gt;";
        break;
      case '"':
        out += "&quot;";
        break;
      default:
        out += c;
    }
  }
  return out;
}

}  // namespace vtc
