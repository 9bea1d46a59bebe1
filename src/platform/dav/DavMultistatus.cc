#include "platform/dav/DavMultistatus.h"

#include <cstdlib>

#include "platform/dav/DavPaths.h"

namespace vtc {

namespace {

constexpr std::string_view kDav = "DAV:";

std::string trim(std::string_view s) {
  size_t b = s.find_first_not_of(" \t\r\n");
  if (b == std::string_view::npos) return {};
  size_t e = s.find_last_not_of(" \t\r\n");
  return std::string(s.substr(b, e - b + 1));
}

// "HTTP/1.1 200 OK" -> 200
int statusCode(const XmlElement* status) {
  if (!status) return 200;
  std::string text = trim(status->allText());
  size_t sp = text.find(' ');
  return sp == std::string::npos ? 0 : std::atoi(text.c_str() + sp + 1);
}

std::string propertyText(const XmlElement& prop) {
  return prop.children.empty() ? prop.text : prop.innerXml();
}

// A sync lock owner record: one element with text children.
void addOwnerFields(const XmlElement& owner, Dictionary& lock) {
  for (const auto& record : owner.children)
    for (const auto& field : record->children) lock.set(field->name, Value(field->allText()));
}

}  // namespace

std::vector<PropfindEntry> readMultistatus(const XmlElement& root) {
  std::vector<PropfindEntry> out;
  if (root.ns != kDav || root.name != "multistatus") return out;
  for (const XmlElement* response : root.childrenNamed(kDav, "response")) {
    const XmlElement* href = response->child(kDav, "href");
    if (!href) continue;
    PropfindEntry entry;
    entry.href = trim(href->allText());
    entry.path = davpath::fromHref(entry.href);
    for (const XmlElement* propstat : response->childrenNamed(kDav, "propstat")) {
      if (statusCode(propstat->child(kDav, "status")) / 100 != 2) continue;
      const XmlElement* prop = propstat->child(kDav, "prop");
      if (!prop) continue;
      for (const auto& p : prop->children) {
        entry.properties.set(p->ns + p->name, Value(propertyText(*p)));
        if (p->ns == kDav && p->name == "lockdiscovery") entry.lockDiscovery = p.get();
      }
    }
    out.push_back(std::move(entry));
  }
  return out;
}

std::pair<std::string, std::string> splitPropertyName(std::string_view fullName) {
  if (fullName.starts_with(kDav))
    return {std::string(kDav), std::string(fullName.substr(kDav.size()))};
  size_t cut = fullName.find_last_of("/#:");
  if (cut == std::string_view::npos) return {"", std::string(fullName)};
  return {std::string(fullName.substr(0, cut + 1)), std::string(fullName.substr(cut + 1))};
}

std::string propfindBody(const std::vector<std::string>& fullNames) {
  std::string body = "<?xml version=\"1.0\" encoding=\"utf-8\"?>\n<D:propfind xmlns:D=\"DAV:\">";
  if (fullNames.empty()) {
    body += "<D:allprop/>";
  } else {
    body += "<D:prop>";
    for (const std::string& full : fullNames) {
      auto [ns, local] = splitPropertyName(full);
      body += "<" + local + " xmlns=\"" + xmlEscape(ns) + "\"/>";
    }
    body += "</D:prop>";
  }
  return body + "</D:propfind>\n";
}

Array readActiveLocks(const XmlElement& lockDiscovery) {
  Array locks;
  for (const XmlElement* active : lockDiscovery.childrenNamed(kDav, "activelock")) {
    Dictionary lock;
    if (const XmlElement* scope = active->child(kDav, "lockscope");
        scope && !scope->children.empty())
      lock.set("scope", Value(scope->children.front()->name));
    if (const XmlElement* depth = active->child(kDav, "depth"))
      lock.set("depth", Value(trim(depth->allText())));
    if (const XmlElement* timeout = active->child(kDav, "timeout"))
      lock.set("timeout", Value(trim(timeout->allText())));
    if (const XmlElement* token = active->child(kDav, "locktoken")) {
      const XmlElement* href = token->child(kDav, "href");
      lock.set("token", Value(trim((href ? href : token)->allText())));
    }
    if (const XmlElement* owner = active->child(kDav, "owner")) {
      lock.set("owner", Value(owner->innerXml()));
      addOwnerFields(*owner, lock);
    }
    locks.push_back(Value(std::move(lock)));
  }
  return locks;
}

Dictionary ownerFields(std::string_view ownerXml) {
  const std::string document = "<owner>" + std::string(ownerXml) + "</owner>";
  ne_xml_parser* parser = ne_xml_create();
  XmlTreeBuilder builder(parser);
  ne_xml_parse(parser, document.data(), document.size());
  ne_xml_parse(parser, "", 0);
  Dictionary fields;
  if (!ne_xml_failed(parser) && builder.root()) addOwnerFields(*builder.root(), fields);
  ne_xml_destroy(parser);
  return fields;
}

}  // namespace vtc
