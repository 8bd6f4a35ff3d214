#include "extract/extract_runner.hpp"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>

#include "extract/content_extract.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace extract {
namespace {

class ExtractRunnerTest : public ::testing::Test {
 protected:
  // Runs with `program` standing in for the helper.
  bool RunWith(const std::string& program, const std::string& path, Json::Value* fields,
               std::string* error, ExtractLimits limits = ExtractLimits()) {
    setenv("FILEINDEX_EXTRACT_HELPER", program.c_str(), 1);
    const bool ok = RunExtractHelper(path, fields, error, limits);
    unsetenv("FILEINDEX_EXTRACT_HELPER");
    return ok;
  }
  std::string Script(const std::string& name, const std::string& body) {
    const std::string path = dir_.Write(name, "#!/bin/sh\n" + body + "\n");
    chmod(path.c_str(), 0755);
    return path;
  }
  test::TempDir dir_;
};

TEST_F(ExtractRunnerTest, RealHelperExtractsAndReportsFailures) {
  Json::Value fields;
  std::string error;
  ASSERT_TRUE(RunWith(EXTRACT_HELPER_BINARY, dir_.Write("a.txt", "hello helper"), &fields, &error))
      << error;
  EXPECT_EQ(fields["QUIXMDTextContent"], "hello helper");
  EXPECT_FALSE(RunWith(EXTRACT_HELPER_BINARY, dir_.Path("missing.txt"), &fields, &error));
  EXPECT_EQ(error, "exited with status 1: cannot open: No such file or directory");
}

// A hostile file is a helper that hangs, floods, crashes or talks nonsense: the indexer gets a
// reason and goes on.
TEST_F(ExtractRunnerTest, MisbehavingHelpersAreContained) {
  Json::Value fields;
  std::string error;
  ExtractLimits quick;
  quick.timeout_ms = 300;
  const auto start = std::chrono::steady_clock::now();
  EXPECT_FALSE(RunWith(Script("hang", "exec sleep 30"), "/x", &fields, &error, quick));
  EXPECT_EQ(error, "timed out after 300 ms");
  EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(5));

  ExtractLimits small;
  small.max_output = 4096;
  EXPECT_FALSE(RunWith(Script("flood", "exec yes"), "/x", &fields, &error, small));
  EXPECT_EQ(error, "printed more than 4096 bytes");

  EXPECT_FALSE(RunWith(Script("crash", "kill -SEGV $$"), "/x", &fields, &error));
  EXPECT_EQ(error, "killed by Segmentation fault");

  EXPECT_FALSE(RunWith(Script("garbage", "echo '[1,2'"), "/x", &fields, &error));
  EXPECT_EQ(error, "printed something that is not a JSON object");

  EXPECT_FALSE(RunWith(dir_.Path("no-such-helper"), "/x", &fields, &error));
  EXPECT_NE(error.find("cannot start"), std::string::npos);
}

TEST_F(ExtractRunnerTest, ParseFileAddsContentOnlyWhenAsked) {
  namespace ce = QUIX::CONTENT_EXTRACT;
  setenv("FILEINDEX_EXTRACT_HELPER", EXTRACT_HELPER_BINARY, 1);
  const std::string path = dir_.Write("notes.txt", "meeting notes");
  Json::Value need_meta;
  need_meta[ce::kKeyNeedMeta] = true;
  Json::Value doc;
  ce::ParseFile(path, need_meta, doc);
  EXPECT_EQ(doc["QUIXMDTextContent"], "meeting notes");
  EXPECT_EQ(doc[ce::QUIXMDFSName], "notes.txt");
  ce::ParseFile(path, Json::Value(Json::objectValue), doc);
  EXPECT_FALSE(doc.isMember("QUIXMDTextContent"));

  // A helper that fails leaves the name and attributes indexed, logged and counted.
  setenv("FILEINDEX_EXTRACT_HELPER", Script("fail", "exit 3").c_str(), 1);
  test::LogCapture log;
  const uint64_t failures = ExtractFailureCount();
  ce::ParseFile(path, need_meta, doc);
  unsetenv("FILEINDEX_EXTRACT_HELPER");
  EXPECT_EQ(doc[ce::QUIXMDFSSize].asUInt64(), 13u);
  EXPECT_FALSE(doc.isMember("QUIXMDTextContent"));
  EXPECT_EQ(ExtractFailureCount(), failures + 1);
  EXPECT_TRUE(log.Contains("content of " + path + " not extracted: exited with status 3"));
}

}  // namespace
}  // namespace extract
}  // namespace orvane
