// Hostile files through the real helper: each ends within the helper's limits with what could be
// read, and the file after it extracts as usual.
#include <gtest/gtest.h>
#include <stdlib.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "extract/extract_runner.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace extract {
namespace {

class HostileTest : public ::testing::Test {
 protected:
  void SetUp() override {
    setenv("FILEINDEX_EXTRACT_HELPER", EXTRACT_HELPER_BINARY, 1);
    CloseIdleExtractHelpers();
  }
  void TearDown() override {
    CloseIdleExtractHelpers();
    unsetenv("FILEINDEX_EXTRACT_HELPER");
  }

  // Runs `script` with bash in the test's folder.
  void Sh(const std::string& script) {
    const test::ProgramResult r = test::RunProgram(
        "/bin/bash", {"-c", "set -eo pipefail; cd '" + dir_.path() + "'; " + script});
    ASSERT_EQ(r.status, 0) << script << "\n" << r.err;
  }

  test::TempDir dir_;
};

struct Case {
  const char* file;
  bool extracted;          // the helper gives fields (false: a reason)
  const char* present;     // in the text ("" for no check)
  const char* absent;      // not in the text ("" for no check)
};

TEST_F(HostileTest, EachEndsWithinTheLimitsAndTheNextFileExtracts) {
  Sh(R"(
    # Zeros compress a thousandfold: a quarter gigabyte in a zip and a gzip, a zip of such zips.
    truncate -s 256M zeros
    zip -q -1 z.zip zeros && gzip -1 -c zeros > bomb.gz && rm zeros
    for i in 1 2 3 4 5 6 7 8; do cp z.zip z$i.zip; done
    echo afterbombword > after.txt
    zip -q -0 bomb.zip z?.zip after.txt && rm z*.zip
    # Twelve zips deep, a word at the bottom.
    echo deepbottomword > bottom.txt && zip -q l11.zip bottom.txt
    for i in $(seq 10 -1 0); do zip -q l$i.zip l$((i + 1)).zip && rm l$((i + 1)).zip; done
    mv l0.zip deep.zip
    # Members named to climb out of any folder they were written to.
    python3 -c '
import tarfile, zipfile, io
with zipfile.ZipFile("climb.zip", "w") as z:
    z.writestr("../../escapedname.txt", "escapedword")
    z.writestr("/tmp/absolutename.txt", "absoluteword")
with tarfile.open("climb.tar", "w") as t:
    data = b"tarescapedword"
    info = tarfile.TarInfo("../../tarescapedname.txt")
    info.size = len(data)
    t.addfile(info, io.BytesIO(data))
'
    # Cut short: the first member whole, the rest missing.
    echo cutfirstword > first.txt && echo cutlastword > last.txt
    head -c 300000 /dev/urandom > noise
    tar czf whole.tar.gz first.txt noise last.txt && head -c 150000 whole.tar.gz > cut.tar.gz
    zip -q -0 whole.zip first.txt noise last.txt && head -c 150000 whole.zip > cut.zip
    rm whole.tar.gz whole.zip noise
    # Two gigabytes of nothing, on its own and as an archive member before a word.
    truncate -s 2G sparse.txt
    echo sparseafterword > word.txt && tar -S -cf sparse.tar sparse.txt word.txt
    echo nextfileword > next.txt
  )");
  if (HasFatalFailure()) return;
  const Case cases[] = {
      // Each bomb inside stops expanding at its ratio, so the member after them is still read.
      {"bomb.zip", true, "afterbombword", ""},
      {"bomb.gz", true, "", ""},
      // Archives in archives are opened a few levels down only.
      {"deep.zip", true, "l2.zip", "deepbottomword"},
      // A member's name is only a name: nothing is written by it.
      {"climb.zip", true, "escapedword", ""},
      {"climb.tar", true, "../../tarescapedname.txt", ""},
      {"cut.tar.gz", true, "cutfirstword", ""},
      {"cut.zip", true, "first.txt", ""},
      {"sparse.txt", true, "", ""},
      {"sparse.tar", true, "sparseafterword", ""},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.file);
    Json::Value fields;
    std::string error;
    const bool ok = RunExtractHelper(dir_.Path(c.file), &fields, &error);
    EXPECT_EQ(ok, c.extracted) << error;
    const std::string text = fields["QUIXMDTextContent"].asString();
    if (c.present[0] != '\0') EXPECT_NE(text.find(c.present), std::string::npos) << text;
    if (c.absent[0] != '\0') EXPECT_EQ(text.find(c.absent), std::string::npos) << text;
    ASSERT_TRUE(RunExtractHelper(dir_.Path("next.txt"), &fields, &error)) << error;
    EXPECT_EQ(fields["QUIXMDTextContent"].asString(), "nextfileword\n");
  }
  for (const char* written : {"../escapedname.txt", "../../escapedname.txt",
                              "../../tarescapedname.txt", "/tmp/absolutename.txt"}) {
    const std::string path = written[0] == '/' ? written : dir_.Path(written);
    EXPECT_NE(access(path.c_str(), F_OK), 0) << path;
  }
}

}  // namespace
}  // namespace extract
}  // namespace orvane
