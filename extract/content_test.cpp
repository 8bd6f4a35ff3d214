#include "extract/content.hpp"

#include <archive.h>
#include <archive_entry.h>
#include <arpa/inet.h>
#include <gtest/gtest.h>
#include <taglib/tag.h>
#include <taglib/wavfile.h>
#include <zlib.h>

#include <cstring>
#include <exiv2/exiv2.hpp>
#include <fstream>
#include <map>

#include "test/test_util.hpp"

namespace orvane {
namespace extract {
namespace {

// Small real files of each kind, made here rather than shipped.
void WriteZip(const std::string& path, const std::map<std::string, std::string>& members) {
  struct archive* zip = archive_write_new();
  archive_write_set_format_zip(zip);
  ASSERT_EQ(archive_write_open_filename(zip, path.c_str()), ARCHIVE_OK);
  for (const auto& [name, data] : members) {
    struct archive_entry* entry = archive_entry_new();
    archive_entry_set_pathname(entry, name.c_str());
    archive_entry_set_filetype(entry, AE_IFREG);
    archive_entry_set_perm(entry, 0644);
    archive_entry_set_size(entry, static_cast<la_int64_t>(data.size()));
    archive_write_header(zip, entry);
    archive_write_data(zip, data.data(), data.size());
    archive_entry_free(entry);
  }
  archive_write_close(zip);
  archive_write_free(zip);
}

std::string Pdf(const std::string& title, const std::string& text) {
  const std::string content = "BT /F1 18 Tf 20 100 Td (" + text + ") Tj ET";
  const std::vector<std::string> objects = {
      "<< /Type /Catalog /Pages 2 0 R >>",
      "<< /Type /Pages /Kids [3 0 R] /Count 1 >>",
      "<< /Type /Page /Parent 2 0 R /MediaBox [0 0 400 144] /Contents 4 0 R "
      "/Resources << /Font << /F1 5 0 R >> >> >>",
      "<< /Length " + std::to_string(content.size()) + " >>\nstream\n" + content + "\nendstream",
      "<< /Type /Font /Subtype /Type1 /BaseFont /Helvetica >>",
      "<< /Title (" + title + ") /Author (Ada Lovelace) /CreationDate (D:20240506070809Z) >>"};
  std::string pdf = "%PDF-1.4\n";
  std::vector<size_t> offsets;
  for (size_t i = 0; i < objects.size(); ++i) {
    offsets.push_back(pdf.size());
    pdf += std::to_string(i + 1) + " 0 obj\n" + objects[i] + "\nendobj\n";
  }
  const size_t xref = pdf.size();
  pdf += "xref\n0 " + std::to_string(objects.size() + 1) + "\n0000000000 65535 f \n";
  for (size_t offset : offsets) {
    char entry[32];
    std::snprintf(entry, sizeof(entry), "%010zu 00000 n \n", offset);
    pdf += entry;
  }
  pdf += "trailer\n<< /Size " + std::to_string(objects.size() + 1) +
         " /Root 1 0 R /Info 6 0 R >>\nstartxref\n" + std::to_string(xref) + "\n%%EOF\n";
  return pdf;
}

std::string Chunk(const std::string& type, const std::string& data) {
  std::string out;
  const uint32_t len = htonl(static_cast<uint32_t>(data.size()));
  out.append(reinterpret_cast<const char*>(&len), 4);
  const std::string body = type + data;
  out += body;
  const uint32_t crc = htonl(static_cast<uint32_t>(
      crc32(0, reinterpret_cast<const Bytef*>(body.data()), static_cast<uInt>(body.size()))));
  out.append(reinterpret_cast<const char*>(&crc), 4);
  return out;
}

std::string Png(uint32_t width, uint32_t height) {
  std::string ihdr;
  const uint32_t w = htonl(width);
  const uint32_t h = htonl(height);
  ihdr.append(reinterpret_cast<const char*>(&w), 4);
  ihdr.append(reinterpret_cast<const char*>(&h), 4);
  ihdr += std::string("\x08\x02\x00\x00\x00", 5);
  std::string raw;
  for (uint32_t y = 0; y < height; ++y) raw += '\0' + std::string(width * 3, '\x7f');
  uLongf size = compressBound(static_cast<uLong>(raw.size()));
  std::string packed(size, '\0');
  compress(reinterpret_cast<Bytef*>(packed.data()), &size,
           reinterpret_cast<const Bytef*>(raw.data()), static_cast<uLong>(raw.size()));
  packed.resize(size);
  return std::string("\x89PNG\r\n\x1a\n", 8) + Chunk("IHDR", ihdr) + Chunk("IDAT", packed) +
         Chunk("IEND", "");
}

std::string Wav(int seconds, uint32_t rate, uint16_t channels) {
  auto u32 = [](uint32_t v) { return std::string(reinterpret_cast<const char*>(&v), 4); };
  auto u16 = [](uint16_t v) { return std::string(reinterpret_cast<const char*>(&v), 2); };
  const uint32_t data_size = static_cast<uint32_t>(seconds) * rate * channels * 2;
  return "RIFF" + u32(36 + data_size) + "WAVEfmt " + u32(16) + u16(1) + u16(channels) + u32(rate) +
         u32(rate * channels * 2) + u16(channels * 2) + u16(16) + "data" + u32(data_size) +
         std::string(data_size, '\0');
}

class ContentTest : public ::testing::Test {
 protected:
  test::TempDir dir_;
};

TEST_F(ContentTest, TextInAnyCommonEncodingBecomesUtf8) {
  EXPECT_EQ(ExtractContent(dir_.Write("a.txt", "caf\xc3\xa9 cr\xc3\xa8me"))["QUIXMDTextContent"],
            "caf\xc3\xa9 cr\xc3\xa8me");
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
  EXPECT_EQ(ToUtf8("ok\xff\xfe", 100).find('\xff'), std::string::npos);
}

TEST_F(ContentTest, PdfTextAndProperties) {
  const Json::Value f =
      ExtractContent(dir_.Write("r.pdf", Pdf("Quarterly Report", "Hello searchable world")));
  EXPECT_EQ(f["QUIXMDTitle"], "Quarterly Report");
  EXPECT_EQ(f["QUIXMDAuthors"], "Ada Lovelace");
  EXPECT_NE(f["QUIXMDTextContent"].asString().find("Hello searchable world"), std::string::npos);
  EXPECT_EQ(f["QUIXMDContentCreationDate"].asInt64(), 1714979289);
  // Damaged beyond repair: an error, not a crash.
  EXPECT_THROW(ExtractContent(dir_.Write("bad.pdf", "%PDF-1.4\n1 0 obj << /Type")), std::exception);
}

TEST_F(ContentTest, OfficeDocuments) {
  WriteZip(dir_.Path("w.docx"),
           {{"[Content_Types].xml", "<Types/>"},
            {"word/document.xml",
             "<w:document xmlns:w=\"w\"><w:body><w:p><w:r><w:t>Hel</w:t></w:r><w:r><w:t>lo"
             "</w:t></w:r></w:p><w:p><w:r><w:t>second &amp; last</w:t></w:r></w:p></w:body>"
             "</w:document>"},
            {"docProps/core.xml",
             "<cp:coreProperties xmlns:cp=\"c\" xmlns:dc=\"d\"><dc:title>Plan</dc:title>"
             "<dc:creator>Grace</dc:creator></cp:coreProperties>"}});
  Json::Value f = ExtractContent(dir_.Path("w.docx"));
  EXPECT_EQ(f["QUIXMDTextContent"], "Hello\nsecond & last\n");
  EXPECT_EQ(f["QUIXMDTitle"], "Plan");
  EXPECT_EQ(f["QUIXMDAuthors"], "Grace");

  WriteZip(dir_.Path("s.pptx"),
           {{"[Content_Types].xml", "<Types/>"},
            {"ppt/slides/slide10.xml", "<p:sld xmlns:a=\"a\"><a:p><a:t>ten</a:t></a:p></p:sld>"},
            {"ppt/slides/slide2.xml", "<p:sld xmlns:a=\"a\"><a:p><a:t>two</a:t></a:p></p:sld>"}});
  EXPECT_EQ(ExtractContent(dir_.Path("s.pptx"))["QUIXMDTextContent"], "two\nten\n");

  WriteZip(dir_.Path("t.odt"),
           {{"mimetype", "application/vnd.oasis.opendocument.text"},
            {"content.xml",
             "<office:document-content xmlns:text=\"t\" xmlns:office=\"o\"><office:body>"
             "<text:p>open document</text:p></office:body></office:document-content>"},
            {"meta.xml",
             "<office:document-meta xmlns:office=\"o\" xmlns:meta=\"m\"><office:meta>"
             "<meta:initial-creator>Linus</meta:initial-creator><meta:keyword>kw</meta:keyword>"
             "</office:meta></office:document-meta>"}});
  f = ExtractContent(dir_.Path("t.odt"));
  EXPECT_EQ(f["QUIXMDTextContent"], "open document\n");
  EXPECT_EQ(f["QUIXMDAuthors"], "Linus");
  EXPECT_EQ(f["QUIXMDKeywords"], "kw");

  // An entity that would expand a billion times is left alone.
  WriteZip(dir_.Path("lol.docx"),
           {{"word/document.xml",
             "<?xml version=\"1.0\"?><!DOCTYPE d [<!ENTITY a \"aaaaaaaaaa\"><!ENTITY b "
             "\"&a;&a;&a;&a;&a;&a;&a;&a;&a;&a;\"><!ENTITY c \"&b;&b;&b;&b;&b;&b;&b;&b;&b;&b;\">]>"
             "<d><p>&c;&c;&c;&c;&c;&c;</p></d>"}});
  EXPECT_LE(ExtractContent(dir_.Path("lol.docx"))["QUIXMDTextContent"].asString().size(), 1000u);
  std::ofstream(dir_.Path("broken.docx")) << "PK\x03\x04 not really";
  EXPECT_THROW(ExtractContent(dir_.Path("broken.docx")), std::exception);
}

TEST_F(ContentTest, AudioTagsAndProperties) {
  const std::string path = dir_.Write("song.wav", Wav(2, 8000, 2));
  {
    TagLib::RIFF::WAV::File file(path.c_str());
    file.ID3v2Tag()->setTitle("Song");
    file.ID3v2Tag()->setArtist("Band");
    file.ID3v2Tag()->setAlbum("Album");
    file.ID3v2Tag()->setYear(1999);
    file.ID3v2Tag()->setTrack(7);
    ASSERT_TRUE(file.save());
  }
  const Json::Value f = ExtractContent(path);
  EXPECT_EQ(f["QUIXMDMediaTypes"], "Sound");
  EXPECT_EQ(f["QUIXMDTitle"], "Song");
  EXPECT_EQ(f["QUIXMDAuthors"], "Band");
  EXPECT_EQ(f["QUIXMDAlbum"], "Album");
  EXPECT_EQ(f["QUIXMDRecordingYear"], 1999);
  EXPECT_EQ(f["QUIXMDAudioTrackNumber"], 7);
  EXPECT_DOUBLE_EQ(f["QUIXMDDurationSecond"].asDouble(), 2.0);
  EXPECT_EQ(f["QUIXMDAudioSampleRate"], 8000);
  EXPECT_EQ(f["QUIXMDAudioChannelCount"], 2);
}

TEST_F(ContentTest, PhotoExif) {
  const std::string path = dir_.Write("p.png", Png(4, 3));
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
  const Json::Value f = ExtractContent(path);
  EXPECT_EQ(f["QUIXMDMediaTypes"], "Image");
  EXPECT_EQ(f["QUIXMDAcquisitionMake"], "Maker");
  EXPECT_EQ(f["QUIXMDAcquisitionModel"], "Model 5");
  EXPECT_EQ(f["QUIXMDAperture"], "f/2.8");
  EXPECT_EQ(f["QUIXMDExposureTimeString"], "1/60");
  EXPECT_EQ(f["QUIXMDISOSpeed"], 200);
  EXPECT_EQ(f["QUIXMDContentCreationDate"].asInt64(), 1714979289);
}

TEST_F(ContentTest, KindsWithNothingToExtract) {
  EXPECT_TRUE(ExtractContent(dir_.Write("x.bin", std::string("\x01\x02\x03\x00\xff", 5)))
                  .getMemberNames()
                  .empty());
  EXPECT_THROW(ExtractContent(dir_.Path("missing.txt")), std::exception);
}

}  // namespace
}  // namespace extract
}  // namespace orvane
