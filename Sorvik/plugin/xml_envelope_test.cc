#include "Sorvik/plugin/xml_envelope.h"

#include <gtest/gtest.h>


namespace ko::core {
namespace {

TEST(XmlEnvelopeTest, AnnouncementIsExact) {
  EXPECT_EQ(announcementText("1.2.3.4"),
            "<?xml ?><Qora Delta=\"0\"><Modules><Module Name=\"Sorvik\" ID=\"3670016\" Version=\"1.2.3.4\" "
            "/></Modules></Qora>");
}

TEST(XmlEnvelopeTest, CompactAndPrettyPrinting) {
  TiXmlDocument doc;
  TiXmlElement* update = buildEnvelope(doc, true);
  update->SetAttribute("DownloadDir", "D:\\a&b<c");
  update->SetAttribute("Timeout", 600);
  EXPECT_EQ(printCompact(doc),
            "<?xml ?><Qora Delta=\"0\"><Update ID=\"3670016\" DownloadDir=\"D:\\a&amp;b&lt;c\" Timeout=\"600\" "
            "/></Qora>");
  EXPECT_EQ(printPretty(doc),
            "<?xml ?>\n<Qora Delta=\"0\">\n    <Update ID=\"3670016\" DownloadDir=\"D:\\a&amp;b&lt;c\" "
            "Timeout=\"600\" />\n</Qora>\n");

  TiXmlDocument bare;
  buildEnvelope(bare, false);
  EXPECT_EQ(printCompact(bare), "<?xml ?><Qora><Update ID=\"3670016\" /></Qora>");
}

TEST(XmlEnvelopeTest, IntegerAttributesScanLikePercentD) {
  TiXmlElement e("Update");
  e.SetAttribute("a", " 42xyz");
  e.SetAttribute("b", "-7");
  e.SetAttribute("c", "x1");
  e.SetAttribute("d", "");
  e.SetAttribute("e", "99999999999");
  int32_t v = 5;
  EXPECT_TRUE(readIntAttribute(&e, "a", &v));
  EXPECT_EQ(v, 42);
  EXPECT_TRUE(readIntAttribute(&e, "b", &v));
  EXPECT_EQ(v, -7);
  EXPECT_FALSE(readIntAttribute(&e, "c", &v));
  EXPECT_FALSE(readIntAttribute(&e, "d", &v));
  EXPECT_FALSE(readIntAttribute(&e, "missing", &v));
  EXPECT_EQ(v, -7);
  EXPECT_TRUE(readIntAttribute(&e, "e", &v));
  EXPECT_EQ(v, INT32_MAX);
}

std::string nested(int depth, const std::string& inner = "") {
  std::string s;
  for (int i = 0; i < depth; ++i) s += "<a x=\"1>2\">";
  s += inner;
  for (int i = 0; i < depth; ++i) s += "</a>";
  return s;
}

TEST(XmlEnvelopeTest, DeepDocumentsAreRefusedBeforeParsing) {
  TiXmlDocument doc;
  const std::string ok = nested(100, "<leaf /><!-- <b><b><b> --><![CDATA[<c><c>]]>");
  EXPECT_FALSE(nestsDeeperThan(ok.data(), ok.size(), 100));
  EXPECT_TRUE(parseHostDocument(reinterpret_cast<const unsigned char*>(ok.data()), ok.size(), &doc));

  const std::string deep = nested(101);
  EXPECT_TRUE(nestsDeeperThan(deep.data(), deep.size(), 100));
  EXPECT_FALSE(parseHostDocument(reinterpret_cast<const unsigned char*>(deep.data()), deep.size(), &doc));

  // Hundreds of thousands of unclosed tags are refused, not recursed into.
  std::string tags;
  for (int i = 0; i < 200000; ++i) tags += "<q>";
  EXPECT_FALSE(parseHostDocument(reinterpret_cast<const unsigned char*>(tags.data()), tags.size(), &doc));

  const std::string garbage = "not xml";
  EXPECT_FALSE(parseHostDocument(reinterpret_cast<const unsigned char*>(garbage.data()), garbage.size(), &doc));
  EXPECT_FALSE(parseHostDocument(nullptr, 0, &doc));
}

}  // namespace
}  // namespace ko::core
