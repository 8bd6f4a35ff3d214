#include "extract/html.hpp"

#include <gtest/gtest.h>

#include "extract/extractor_test_util.hpp"
#include "test/sample_files.hpp"

namespace orvane {
namespace extract {
namespace {

using HtmlTest = ExtractorTest;

TEST_F(HtmlTest, VisibleTextTitleAndMetaFields) {
  const Json::Value f = Run(ExtractHtml, dir_.Write("p.html", R"(<!DOCTYPE html>
<html><head><title> The  Plan </title>
<meta name="Author" content="Grace Hopper"><meta name="keywords" content="alpha, beta">
<meta name="description" content="what we do"><style>p { color: stylerule }</style>
<script>var scriptword = 1;</script></head>
<body><h1>Heading</h1><p>first<b>bold</b>
   joined</p><div>second</div><ul><li>one</li><li>two</li></ul>
<template>templateword</template><p>caf&eacute; &amp; cr&#232;me</p></body></html>)"));
  EXPECT_EQ(f["QUIXMDTitle"], "The  Plan");
  EXPECT_EQ(f["QUIXMDAuthors"], "Grace Hopper");
  EXPECT_EQ(f["QUIXMDKeywords"], "alpha, beta");
  EXPECT_EQ(f["QUIXMDDescription"], "what we do");
  // Blocks end lines, inline elements do not split words, and nothing hidden is kept.
  EXPECT_EQ(f["QUIXMDTextContent"],
            "Heading\nfirstbold joined\nsecond\none\ntwo\ncaf\xc3\xa9 & cr\xc3\xa8me");
}

TEST_F(HtmlTest, DeclaredAndUndeclaredEncodings) {
  const Json::Value latin =
      Run(ExtractHtml, dir_.Write("l.html",
                                  "<html><head><meta charset=\"iso-8859-1\"></head>"
                                  "<body>d\xe9j\xe0 vu</body></html>"));
  EXPECT_EQ(latin["QUIXMDTextContent"], "d\xc3\xa9j\xc3\xa0 vu");
  const Json::Value utf8 =
      Run(ExtractHtml, dir_.Write("u.html", "<p>na\xc3\xafve \xe2\x82\xac</p>"));
  EXPECT_EQ(utf8["QUIXMDTextContent"], "na\xc3\xafve \xe2\x82\xac");
}

TEST_F(HtmlTest, MalformedAndDeepPagesStillGiveTheirText) {
  // Unclosed tags, stray closers and a nesting far deeper than any parser's stack.
  std::string deep = "<p>start <b><i>unclosed</p></div></span> tail";
  for (int i = 0; i < 200000; ++i) deep += "<div>";
  deep += "bottomword";
  const Json::Value f = Run(ExtractHtml, dir_.Write("bad.html", deep));
  const std::string text = f["QUIXMDTextContent"].asString();
  EXPECT_NE(text.find("start unclosed"), std::string::npos) << text;
  EXPECT_NE(text.find("tail"), std::string::npos) << text;
  EXPECT_TRUE(Run(ExtractHtml, dir_.Write("empty.html", "")).getMemberNames().empty());
}

TEST_F(HtmlTest, XmlTextNodesAreSeparateWordsAndEntitiesStayUnexpanded) {
  const Json::Value f =
      Run(ExtractXml, dir_.Write("d.xml",
                                 "<?xml version=\"1.0\"?><!DOCTYPE r PUBLIC \"-//Us//DTD R//EN\" "
                                 "\"r.dtd\"><r><a>alpha</a><b>beta<c k=\"v\">gamma</c></b>"
                                 "<![CDATA[delta]]><!-- note --><a/></r>"));
  // The text first, then the document type and the names and values the file uses, each once.
  EXPECT_EQ(f["QUIXMDTextContent"],
            "alpha\nbeta\ngamma\ndelta\nnote\nr\nPUBLIC\n-//Us//DTD R//EN\nr.dtd\na\nb\nc\nk\nv");
  const Json::Value bomb =
      Run(ExtractXml, dir_.Write("lol.xml",
                                 "<?xml version=\"1.0\"?><!DOCTYPE d [<!ENTITY a \"aaaaaaaaaa\">"
                                 "<!ENTITY b \"&a;&a;&a;&a;&a;&a;&a;&a;&a;&a;\"><!ENTITY c "
                                 "\"&b;&b;&b;&b;&b;&b;&b;&b;&b;&b;\">]><d>x &c;&c;&c;</d>"));
  EXPECT_LE(bomb["QUIXMDTextContent"].asString().size(), 100u);
}

TEST_F(HtmlTest, EpubChaptersInSpineOrderWithPackageMetadata) {
  // The archive holds the chapters in the opposite order to the spine.
  ASSERT_TRUE(test::WriteSampleZip(
      dir_.Path("b.epub"),
      {{"mimetype", "application/epub+zip"},
       {"META-INF/container.xml",
        R"(<container xmlns="urn:oasis:names:tc:opendocument:xmlns:container"><rootfiles>)"
        R"(<rootfile full-path="OEBPS/content.opf"/></rootfiles></container>)"},
       {"OEBPS/content.opf",
        R"(<package xmlns="http://www.idpf.org/2007/opf" xmlns:dc="http://purl.org/dc/elements/1.1/">)"
        R"(<metadata><dc:title>Sea Tales</dc:title><dc:creator>Ann</dc:creator>)"
        R"(<dc:creator>Bo</dc:creator><dc:language>en</dc:language></metadata>)"
        R"(<manifest><item id="c1" href="text/z%20first.xhtml"/><item id="c2")"
        R"( href="../OEBPS/text/a_last.xhtml#top"/><item id="css" href="s.css"/></manifest>)"
        R"(<spine><itemref idref="c1"/><itemref idref="c2"/></spine></package>)"},
       {"OEBPS/text/a_last.xhtml", "<html><body><p>lastchapter</p></body></html>"},
       {"OEBPS/text/z first.xhtml",
        "<html xmlns=\"http://www.w3.org/1999/xhtml\"><head><title>T1</title></head>"
        "<body><p>firstchapter</p></body></html>"},
       {"OEBPS/text/unlisted.xhtml", "<p>unlistedchapter</p>"}}));
  const Json::Value f = Run(ExtractEpub, dir_.Path("b.epub"));
  EXPECT_EQ(f["QUIXMDTitle"], "Sea Tales");
  EXPECT_EQ(f["QUIXMDAuthors"], "Ann, Bo");
  EXPECT_EQ(f["QUIXMDLanguages"], "en");
  EXPECT_EQ(f["QUIXMDTextContent"], "firstchapter\nlastchapter");

  ASSERT_TRUE(test::WriteSampleZip(dir_.Path("nopkg.epub"), {{"a.xhtml", "<p>x</p>"}}));
  EXPECT_THROW(Run(ExtractEpub, dir_.Path("nopkg.epub")), std::exception);
}

}  // namespace
}  // namespace extract
}  // namespace orvane
