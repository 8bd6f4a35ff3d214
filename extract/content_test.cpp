#include "extract/content.hpp"

#include <gtest/gtest.h>
#include <taglib/tag.h>
#include <taglib/wavfile.h>

#include <exiv2/exiv2.hpp>
#include <fstream>

#include "common/json_util.hpp"
#include "test/sample_files.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace extract {
namespace {

class ContentTest : public ::testing::Test {
 protected:
  test::TempDir dir_;
};

TEST_F(ContentTest, TextInAnyCommonEncodingBecomesUtf8AndOtherBytesGiveNothing) {
  // Latin-1 bytes are recognised and converted.
  const std::string latin1 =
      "Le caf\xe9 est tr\xe8s bon et la cr\xe8me br\xfbl\xe9"
      "e aussi, d\xe9j\xe0 vu.\n";
  const std::string text =
      ExtractContent(dir_.Write("b.txt", latin1 + latin1 + latin1))["QUIXMDTextContent"].asString();
  EXPECT_NE(text.find("caf\xc3\xa9 est tr\xc3\xa8s bon"), std::string::npos) << text;
  // The cap falls on a character boundary.
  std::string big;
  while (big.size() < kMaxTextBytes + 10) big += "\xc3\xa9";
  const std::string capped =
      ExtractContent(dir_.Write("c.txt", big))["QUIXMDTextContent"].asString();
  EXPECT_LE(capped.size(), kMaxTextBytes);
  EXPECT_EQ(capped.size() % 2, 0u);
  // Bytes of no known kind give nothing; a file that cannot be read is an error.
  EXPECT_TRUE(ExtractContent(dir_.Write("x.bin", std::string("\x01\x02\x03\x00\xff", 5)))
                  .getMemberNames()
                  .empty());
  EXPECT_THROW(ExtractContent(dir_.Path("missing.txt")), std::exception);
}

TEST_F(ContentTest, PdfTextAndProperties) {
  const Json::Value f = ExtractContent(
      dir_.Write("r.pdf", test::SamplePdf("Quarterly Report", "Hello searchable world")));
  EXPECT_EQ(f["QUIXMDTitle"], "Quarterly Report");
  EXPECT_EQ(f["QUIXMDAuthors"], "Ada Lovelace");
  EXPECT_NE(f["QUIXMDTextContent"].asString().find("Hello searchable world"), std::string::npos);
  EXPECT_EQ(f["QUIXMDContentCreationDate"].asInt64(), 1714979289);
  // Damaged beyond repair: an error, not a crash.
  EXPECT_THROW(ExtractContent(dir_.Write("bad.pdf", "%PDF-1.4\n1 0 obj << /Type")), std::exception);
}

TEST_F(ContentTest, OfficeDocuments) {
  ASSERT_TRUE(test::WriteSampleZip(
      dir_.Path("w.docx"),
      {{"[Content_Types].xml", "<Types/>"},
       {"word/document.xml",
        "<w:document xmlns:w=\"w\"><w:body><w:p><w:r><w:t>Hel</w:t></w:r><w:r><w:t>lo"
        "</w:t></w:r></w:p><w:p><w:r><w:t>second &amp; last</w:t></w:r></w:p></w:body>"
        "</w:document>"},
       {"docProps/core.xml",
        "<cp:coreProperties xmlns:cp=\"c\" xmlns:dc=\"d\"><dc:title>Plan</dc:title>"
        "<dc:creator>Grace</dc:creator></cp:coreProperties>"}}));
  Json::Value f = ExtractContent(dir_.Path("w.docx"));
  EXPECT_EQ(f["QUIXMDTextContent"], "Hello\nsecond & last\n");
  EXPECT_EQ(f["QUIXMDTitle"], "Plan");
  EXPECT_EQ(f["QUIXMDAuthors"], "Grace");

  ASSERT_TRUE(test::WriteSampleZip(
      dir_.Path("s.pptx"),
      {{"[Content_Types].xml", "<Types/>"},
       {"ppt/slides/slide10.xml", "<p:sld xmlns:a=\"a\"><a:p><a:t>ten</a:t></a:p></p:sld>"},
       {"ppt/slides/slide2.xml", "<p:sld xmlns:a=\"a\"><a:p><a:t>two</a:t></a:p></p:sld>"}}));
  EXPECT_EQ(ExtractContent(dir_.Path("s.pptx"))["QUIXMDTextContent"], "two\nten\n");

  ASSERT_TRUE(test::WriteSampleZip(
      dir_.Path("t.odt"),
      {{"mimetype", "application/vnd.oasis.opendocument.text"},
       {"content.xml",
        "<office:document-content xmlns:text=\"t\" xmlns:office=\"o\"><office:body>"
        "<text:p>open document</text:p></office:body></office:document-content>"},
       {"meta.xml",
        "<office:document-meta xmlns:office=\"o\" xmlns:meta=\"m\"><office:meta>"
        "<meta:initial-creator>Linus</meta:initial-creator><meta:keyword>kw</meta:keyword>"
        "</office:meta></office:document-meta>"}}));
  f = ExtractContent(dir_.Path("t.odt"));
  EXPECT_EQ(f["QUIXMDTextContent"], "open document\n");
  EXPECT_EQ(f["QUIXMDAuthors"], "Linus");
  EXPECT_EQ(f["QUIXMDKeywords"], "kw");

  // An entity that would expand a billion times is left alone.
  ASSERT_TRUE(test::WriteSampleZip(
      dir_.Path("lol.docx"),
      {{"word/document.xml",
        "<?xml version=\"1.0\"?><!DOCTYPE d [<!ENTITY a \"aaaaaaaaaa\"><!ENTITY b "
        "\"&a;&a;&a;&a;&a;&a;&a;&a;&a;&a;\"><!ENTITY c \"&b;&b;&b;&b;&b;&b;&b;&b;&b;&b;\">]>"
        "<d><p>&c;&c;&c;&c;&c;&c;</p></d>"}}));
  EXPECT_LE(ExtractContent(dir_.Path("lol.docx"))["QUIXMDTextContent"].asString().size(), 1000u);
  std::ofstream(dir_.Path("broken.docx")) << "PK\x03\x04 not really";
  EXPECT_THROW(ExtractContent(dir_.Path("broken.docx")), std::exception);
}

TEST_F(ContentTest, AudioTagsAndProperties) {
  const std::string path = dir_.Write("song.wav", test::SampleWav(2, 8000, 2));
  {
    TagLib::RIFF::WAV::File file(path.c_str());
    file.ID3v2Tag()->setTitle("Song");
    file.ID3v2Tag()->setArtist("Band");
    file.ID3v2Tag()->setAlbum("Album");
    file.ID3v2Tag()->setYear(1999);
    file.ID3v2Tag()->setTrack(7);
    ASSERT_TRUE(file.save());
  }
  Json::Value f = ExtractContent(path);
  EXPECT_DOUBLE_EQ(f["QUIXMDDurationSecond"].asDouble(), 2.0);
  f.removeMember("QUIXMDDurationSecond");
  EXPECT_EQ(JsonToString(f),
            R"({"QUIXMDAlbum":"Album","QUIXMDAudioBitRate":256,"QUIXMDAudioChannelCount":2,)"
            R"("QUIXMDAudioSampleRate":8000,"QUIXMDAudioTrackNumber":7,"QUIXMDAuthors":"Band",)"
            R"("QUIXMDMediaTypes":"Sound","QUIXMDRecordingYear":1999,"QUIXMDTitle":"Song"})");
}

TEST_F(ContentTest, PhotoExif) {
  const std::string path = dir_.Write("p.png", test::SamplePng(4, 3));
  {
    auto image = Exiv2::ImageFactory::open(path);
    image->readMetadata();
    Exiv2::ExifData exif;
    exif["Exif.Image.Make"] = "Maker";
    exif["Exif.Image.Model"] = "Model 5";
    exif["Exif.Photo.FNumber"] = Exiv2::URational(28, 10);
    exif["Exif.Photo.ExposureTime"] = Exiv2::URational(1, 60);
    exif["Exif.Photo.ISOSpeedRatings"] = uint16_t(200);
    exif["Exif.Photo.DateTimeOriginal"] = "2024:05:06 07:08:09";
    image->setExifData(exif);
    image->writeMetadata();
  }
  EXPECT_EQ(
      JsonToString(ExtractContent(path)),
      R"({"QUIXMDAcquisitionMake":"Maker","QUIXMDAcquisitionModel":"Model 5",)"
      R"("QUIXMDAperture":"f/2.8","QUIXMDContentCreationDate":1714979289,)"
      R"("QUIXMDExposureTimeString":"1/60","QUIXMDISOSpeed":200,"QUIXMDMediaTypes":"Image",)"
      R"("QUIXMDPixelHeight":3,"QUIXMDPixelWidth":4})");
}

}  // namespace
}  // namespace extract
}  // namespace orvane
