// Every kind of file the extractor reads, each made here with the tools that make such files
// for real, must give its word (and the fields it promises).
#include <gtest/gtest.h>

#include <functional>
#include <map>
#include <string>
#include <vector>

#include "extract/content.hpp"
#include "test/sample_files.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace extract {
namespace {

// Makes a corpus file in the folder it is given.
using Maker = std::function<void(const test::TempDir&)>;

// Runs `script` with bash in the corpus folder; it fails the test when the tools do.
Maker Sh(const std::string& script) {
  return [script](const test::TempDir& dir) {
    const test::ProgramResult r = test::RunProgram(
        "/bin/bash", {"-c", "set -eo pipefail; cd '" + dir.path() + "'; " + script});
    ASSERT_EQ(r.status, 0) << script << "\n" << r.err;
  };
}

Maker SamplePdfAt(const std::string& name, const std::string& text) {
  return
      [=](const test::TempDir& dir) { dir.Write(name, test::SamplePdf("Quarterly Report", text)); };
}

struct Row {
  const char* file;  // the file extracted, which `make` leaves in the corpus folder
  Maker make;
  // Found in the text; "" when the file must give no text at all.
  const char* word;
  std::map<std::string, std::string> fields;  // further fields and their values
};

// One row per kind; a kind's extractor adds its rows here.
std::vector<Row> Rows() {
  return {
      {"plain.txt", Sh("echo 'one plainword here' > plain.txt"), "plainword", {}},
      {"wide.txt", Sh("echo 'sixteen widewordy' | iconv -t UTF-16 > wide.txt"), "widewordy", {}},
      // Binary bytes under a text's name are not text.
      {"noise.txt", Sh("head -c 4096 /dev/urandom > noise.txt"), "", {}},
      // A misnamed file is read by its contents.
      {"report.txt",
       SamplePdfAt("report.txt", "misnamedpdfword"),
       "misnamedpdfword",
       {{"QUIXMDTitle", "Quarterly Report"}}},
      {"app.log", Sh("echo 'a logword line' | gzip > app.log"), "logword", {}},
      // Compressed single files give what they hold, as its own kind.
      {"t.txt.gz", Sh("echo 'gzipword' > t.txt && gzip t.txt"), "gzipword", {}},
      {"t.txt.bz2", Sh("echo 'bzipword' > t.txt && bzip2 t.txt"), "bzipword", {}},
      {"t.txt.xz", Sh("echo 'xzword' > t.txt && xz t.txt"), "xzword", {}},
      {"t.txt.zst", Sh("echo 'zstdword' > t.txt && zstd -q --rm t.txt"), "zstdword", {}},
      {"t.txt.lz4",
       Sh("echo 'lzfourword' > t.txt && lz4 -q --rm t.txt t.txt.lz4"),
       "lzfourword",
       {}},
      {"r.pdf.gz",
       [](const test::TempDir& dir) {
         SamplePdfAt("r.pdf", "gzippedpdfword")(dir);
         Sh("gzip r.pdf")(dir);
       },
       "gzippedpdfword",
       {{"QUIXMDTitle", "Quarterly Report"}}},
      // Archives give their members' names and texts.
      {"a.zip", Sh("mkdir d && echo zipword > d/m.txt && zip -qr a.zip d"), "zipword", {}},
      {"a.tar", Sh("echo tarword > m.txt && tar cf a.tar m.txt"), "tarword", {}},
      {"a.tar.gz", Sh("echo targzword > m.txt && tar czf a.tar.gz m.txt"), "targzword", {}},
      {"a.7z", Sh("echo sevenword > m.txt && 7z a -bd a.7z m.txt >/dev/null"), "sevenword", {}},
      {"a.cpio",
       Sh("echo cpioword > m.txt && echo m.txt | cpio -o -H newc > a.cpio 2>/dev/null"),
       "cpioword",
       {}},
      {"a.a", Sh("echo arword > m.txt && ar rc a.a m.txt"), "arword", {}},
      {"p.deb",
       Sh("mkdir -p p/DEBIAN p/usr/share/doc/p && echo debword > p/usr/share/doc/p/README && "
          "printf 'Package: p\\nVersion: 1\\nArchitecture: all\\nMaintainer: m <m@x>\\n"
          "Description: d\\n' > p/DEBIAN/control && dpkg-deb -Zxz -b p p.deb >/dev/null"),
       "debword",
       {}},
      // Encrypted members give their names only, and the archive says it holds some.
      {"secret.zip",
       Sh("echo secretword > s.txt && zip -q -P pw secret.zip s.txt"),
       "s.txt",
       {{"QUIXMDIsEncrypted", "true"}}},
      // Archives in archives are read as archives.
      {"nest.tgz",
       Sh("echo nestedword > n.txt && zip -q in.zip n.txt && tar czf nest.tgz in.zip"),
       "nestedword",
       {}},
  };
}

TEST(CorpusTest, EveryKindGivesItsWordAndFields) {
  for (const Row& row : Rows()) {
    SCOPED_TRACE(row.file);
    const test::TempDir dir;
    row.make(dir);
    if (::testing::Test::HasFatalFailure()) return;
    Json::Value fields;
    try {
      fields = ExtractContent(dir.Path(row.file));
    } catch (const std::exception& e) {
      ADD_FAILURE() << e.what();
      continue;
    }
    const std::string text = fields["QUIXMDTextContent"].asString();
    if (row.word[0] == '\0') {
      EXPECT_EQ(text, "");
    } else {
      EXPECT_NE(text.find(row.word), std::string::npos) << text.substr(0, 400);
    }
    for (const auto& [key, value] : row.fields) EXPECT_EQ(fields[key].asString(), value) << key;
  }
}

}  // namespace
}  // namespace extract
}  // namespace orvane
