#include "test/sample_files.hpp"

#include <archive.h>
#include <archive_entry.h>
#include <arpa/inet.h>
#include <zlib.h>

#include <cstdio>
#include <vector>

namespace orvane {
namespace test {
namespace {

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

}  // namespace

std::string SamplePdf(const std::string& title, const std::string& text) {
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

bool WriteSampleZip(const std::string& path, const std::map<std::string, std::string>& members) {
  struct archive* zip = archive_write_new();
  archive_write_set_format_zip(zip);
  bool ok = archive_write_open_filename(zip, path.c_str()) == ARCHIVE_OK;
  for (auto it = members.begin(); ok && it != members.end(); ++it) {
    struct archive_entry* entry = archive_entry_new();
    archive_entry_set_pathname(entry, it->first.c_str());
    archive_entry_set_filetype(entry, AE_IFREG);
    archive_entry_set_perm(entry, 0644);
    archive_entry_set_size(entry, static_cast<la_int64_t>(it->second.size()));
    ok = archive_write_header(zip, entry) == ARCHIVE_OK &&
         archive_write_data(zip, it->second.data(), it->second.size()) ==
             static_cast<la_ssize_t>(it->second.size());
    archive_entry_free(entry);
  }
  ok = archive_write_close(zip) == ARCHIVE_OK && ok;
  archive_write_free(zip);
  return ok;
}

std::string SamplePng(uint32_t width, uint32_t height) {
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

std::string SampleWav(int seconds, uint32_t rate, uint16_t channels) {
  auto u32 = [](uint32_t v) { return std::string(reinterpret_cast<const char*>(&v), 4); };
  auto u16 = [](uint16_t v) { return std::string(reinterpret_cast<const char*>(&v), 2); };
  const uint32_t data_size = static_cast<uint32_t>(seconds) * rate * channels * 2;
  return "RIFF" + u32(36 + data_size) + "WAVEfmt " + u32(16) + u16(1) + u16(channels) + u32(rate) +
         u32(rate * channels * 2) + u16(channels * 2) + u16(16) + "data" + u32(data_size) +
         std::string(data_size, '\0');
}

}  // namespace test
}  // namespace orvane
