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

// A page of PostScript with two words on it, and the ghostscript command that renders it (the
// device's name follows).
const char kPage[] =
    "%%!PS\\n/Helvetica findfont 40 scalefont setfont 30 40 moveto (Quokka lighthouse) show "
    "showpage\\n";
const char kRender[] =
    "gs -q -dSAFER -dBATCH -dNOPAUSE -r150 -dDEVICEWIDTHPOINTS=400 -dDEVICEHEIGHTPOINTS=120 "
    "-sDEVICE=";

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
      // Markup: pages give their visible text and their title and author.
      {"page.html",
       Sh(R"(printf '<!DOCTYPE html><html><head><title>Tide Tables</title><meta name="author" )"
          R"(content="Ann Lee"></head><body><p>htmlword</p><script>x()</script></body></html>' > page.html)"),
       "htmlword",
       {{"QUIXMDTitle", "Tide Tables"}, {"QUIXMDAuthors", "Ann Lee"}}},
      {"page.xhtml",
       Sh(R"(printf '<?xml version="1.0" encoding="UTF-8"?>\n<html xmlns="http://www.w3.org/1999/xhtml">)"
          R"(<head><title>X Page</title></head><body><p>xhtmlword</p></body></html>\n' > page.xhtml)"),
       "xhtmlword",
       {{"QUIXMDTitle", "X Page"}}},
      {"data.xml",
       Sh(R"(printf '<?xml version="1.0"?>\n<catalog><item sku="skuvalue">xmlword</item></catalog>\n' > data.xml)"),
       "xmlword",
       {}},
      // Markdown that mentions a tag is still text, read to its end.
      {"notes.md",
       Sh(R"(printf '# Notes\n\nUse the `<script>` tag with care.\n\n<div>a block</div>\n\nmarkdownword\n' > notes.md)"),
       "markdownword",
       {}},
      {"guide.rst", Sh(R"(printf 'Guide\n=====\n\n*rstword* here\n' > guide.rst)"), "rstword", {}},
      // Mail written by hand: a Latin-1 body and a base64 attachment.
      {"m.eml",
       Sh(R"(printf 'From: Ann <ann@example.org>\nTo: bob@example.org\nSubject: Tide report\n)"
          R"(MIME-Version: 1.0\nContent-Type: multipart/mixed; boundary=b\n\n--b\n)"
          R"(Content-Type: text/plain; charset=iso-8859-1\nContent-Transfer-Encoding: 8bit\n\n)"
          R"(caf\xe9 mailword\n--b\nContent-Type: application/octet-stream; name=t.txt\n)"
          R"sh(Content-Transfer-Encoding: base64\n\n%s\n--b--\n' "$(echo attachword | base64)" > m.eml)sh"),
       "attachword",
       {{"QUIXMDTitle", "Tide report"}, {"QUIXMDAuthors", "Ann <ann@example.org>"}}},
      {"inbox",
       Sh(R"(printf 'From ann@example.org Mon Jan  1 00:00:00 2024\nFrom: ann@example.org\n)"
          R"(Subject: one\n\nmboxword\n' > inbox)"),
       "mboxword",
       {}},
      {"book.epub",
       Sh(R"(mkdir -p META-INF OEBPS && printf 'application/epub+zip' > mimetype && )"
          R"(printf '<container><rootfiles><rootfile full-path="OEBPS/b.opf"/></rootfiles></container>' )"
          R"(> META-INF/container.xml && printf '<package xmlns:dc="http://purl.org/dc/elements/1.1/">)"
          R"(<metadata><dc:title>Sea Book</dc:title></metadata><manifest><item id="c" href="c.xhtml"/>)"
          R"(</manifest><spine><itemref idref="c"/></spine></package>' > OEBPS/b.opf && )"
          R"(printf '<html><body><p>epubword</p></body></html>' > OEBPS/c.xhtml && )"
          R"(zip -qX0 book.epub mimetype && zip -qr book.epub META-INF OEBPS)"),
       "epubword",
       {{"QUIXMDTitle", "Sea Book"}}},
      // Formats read by Debian's converters.
      {"a.rtf",
       Sh(R"(printf '{\\rtf1\\ansi{\\info{\\title Plan}}\\pard rtfword\\par}' > a.rtf)"),
       "rtfword",
       {{"QUIXMDTitle", "Plan"}}},
      {"tool.1",
       Sh(R"(printf '.TH TOOL 1\n.SH NAME\ntool \\- manword\n' > tool.1)"),
       "manword",
       {}},
      {"tool.1.gz",
       Sh(R"(printf '.TH TOOL 1\n.SH NAME\ntool \\- gzmanword\n' | gzip > tool.1.gz)"),
       "gzmanword",
       {}},
      {"w.ps", Sh(std::string("printf '") + kPage + "' > w.ps"), "Quokka lighthouse", {}},
      {"w.djvu",
       Sh(std::string("printf '") + kPage + "' | " + kRender + "pbmraw -sOutputFile=w.pbm - && " +
          "cjb2 w.pbm w.djvu && printf '(page 0 0 833 250 (word 10 10 300 80 \"djvuword\"))' > "
          "t.txt && djvused w.djvu -e 'select 1; set-txt t.txt' -s"),
       "djvuword",
       {}},
      // Text drawn in an image is recognised (the photo switch decides whether it is read).
      {"w.png",
       Sh(std::string("printf '") + kPage + "' | " + kRender + "pnggray -sOutputFile=w.png -"),
       "Quokka lighthouse",
       {{"QUIXMDMediaTypes", "Image"}}},
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
