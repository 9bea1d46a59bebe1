// Reading multistatus answers and lock discovery as servers send them,
// including the awkward ones.
#include <gtest/gtest.h>

#include <ne_xml.h>

#include "platform/dav/DavMultistatus.h"
#include "platform/dav/XmlTree.h"

namespace {

// Parses a document; nullptr when the parser refused it.
struct Parsed {
  ne_xml_parser* parser = ne_xml_create();
  vtc::XmlTreeBuilder builder{parser};
  bool ok;
  explicit Parsed(const std::string& xml) {
    ok = ne_xml_parse(parser, xml.data(), xml.size()) == 0 && ne_xml_parse(parser, "", 0) == 0 &&
         !ne_xml_failed(parser);
  }
  ~Parsed() { ne_xml_destroy(parser); }
};

TEST(Multistatus, KeepsSuccessfulPropertiesOfEveryResponseByUnescapedPath) {
  Parsed doc(R"(<?xml version="1.0"?>
<D:multistatus xmlns:D="DAV:" xmlns:S="http://nubilo.example/ns/sync/">
 <D:response><D:href>http://h:1/Sync/My%20Folder/</D:href>
  <D:propstat><D:prop><S:maxversion>00007</S:maxversion><D:resourcetype><D:collection/></D:resourcetype>
   <S:note>a &amp; b &lt;c&gt;</S:note></D:prop><D:status>HTTP/1.1 200 OK</D:status></D:propstat>
  <D:propstat><D:prop><S:minversion/></D:prop><D:status>HTTP/1.1 404 Not Found</D:status></D:propstat>
 </D:response>
 <D:response><D:propstat/></D:response>
 <D:response><D:href>/Sync/My%20Folder/a%2Bb.clog</D:href>
  <D:propstat><D:prop><D:getcontentlength>12</D:getcontentlength></D:prop>
   <D:status>HTTP/1.1 200 OK</D:status></D:propstat></D:response>
</D:multistatus>)");
  ASSERT_TRUE(doc.ok);
  auto entries = vtc::readMultistatus(*doc.builder.root());
  ASSERT_EQ(entries.size(), 2u);  // the response without an href is skipped
  EXPECT_EQ(entries[0].path, "/Sync/My Folder/");
  const auto& p = entries[0].properties;
  EXPECT_EQ(p.get("http://nubilo.example/ns/sync/maxversion").string(), "00007");
  EXPECT_EQ(p.get("http://nubilo.example/ns/sync/note").string(), "a & b <c>");
  EXPECT_FALSE(p.contains("http://nubilo.example/ns/sync/minversion"));  // 404 propstat
  EXPECT_EQ(p.get("DAV:resourcetype").string(), "<collection xmlns=\"DAV:\"/>");
  EXPECT_EQ(entries[1].path, "/Sync/My Folder/a+b.clog");
}

TEST(Multistatus, HostileDocumentsAreRefusedOrIgnored) {
  std::string deep = "<a>";
  for (int i = 0; i < 100000; ++i) deep += "<b>";
  EXPECT_FALSE(Parsed(deep).ok);  // too deep: refused, not a stack overflow
  Parsed other("<html><body>not dav</body></html>");
  ASSERT_TRUE(other.ok);
  EXPECT_TRUE(vtc::readMultistatus(*other.builder.root()).empty());
  EXPECT_FALSE(Parsed("<D:multistatus xmlns:D=\"DAV:\"><D:response>").ok);
}

TEST(Multistatus, PropertyNamesSplitIntoNamespaceAndLocalName) {
  using P = std::pair<std::string, std::string>;
  EXPECT_EQ(vtc::splitPropertyName("DAV:getetag"), (P{"DAV:", "getetag"}));
  EXPECT_EQ(vtc::splitPropertyName("http://nubilo.example/ns/sync/minversion"),
            (P{"http://nubilo.example/ns/sync/", "minversion"}));
  EXPECT_EQ(vtc::splitPropertyName("urn:x#y"), (P{"urn:x#", "y"}));
}

}  // namespace
