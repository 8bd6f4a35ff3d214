#include "extract/content_extract.hpp"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include "common/error.hpp"
#include "common/json_util.hpp"
#include "test/test_util.hpp"

namespace QUIX {
namespace CONTENT_EXTRACT {
namespace {

TEST(ParseFileTest, FillsTheFileSystemFieldsOfFilesDirectoriesAndLinksOrThrows) {
  orvane::test::TempDir dir;
  const std::string file = dir.Write("docs/Report.Final.PDF", "12345");
  ASSERT_EQ(chown(file.c_str(), 1234, 567), 0);
  struct stat st;
  ASSERT_EQ(lstat(file.c_str(), &st), 0);

  Json::Value doc(Json::objectValue);
  doc["stale"] = 1;
  ParseFile(file, Json::Value(), doc);
  auto take = [&doc](const char* key) {
    Json::Value value;
    doc.removeMember(key, &value);
    return value.asInt64();
  };
  EXPECT_EQ(take(QUIXMDFSContentChangeDate), st.st_mtime);
  EXPECT_EQ(take(QUIXMDAttributeChangeDate), st.st_ctime);
  EXPECT_LE(take(QUIXMDFSCreationDate), st.st_ctime);  // 0 where no birth time is kept
  EXPECT_EQ(orvane::JsonToString(doc),
            R"({"QUIXMDExtension":"pdf","QUIXMDFSName":"Report.Final.PDF","QUIXMDFSSize":5,)"
            R"("QUIXMDIsDir":false,"QUIXMDOwnerGroupID":"567","QUIXMDOwnerUserID":"1234",)"
            R"("QUIXMDParent":")" + dir.Path("docs") + R"(","QUIXMDPath":")" + file + R"("})");

  Json::Value config;
  config[kKeyNeedMeta] = true;
  ParseFile(dir.Path("docs"), config, doc);
  EXPECT_TRUE(doc[QUIXMDIsDir].asBool());
  EXPECT_EQ(doc[QUIXMDExtension].asString(), "");

  // A link is described as itself, even when it dangles.
  ASSERT_EQ(symlink("/nowhere/x.txt", dir.Path("link.mp3").c_str()), 0);
  ParseFile(dir.Path("link.mp3"), config, doc);
  EXPECT_FALSE(doc[QUIXMDIsDir].asBool());
  EXPECT_EQ(doc[QUIXMDExtension].asString(), "mp3");

  orvane::test::LogCapture log;  // keeps the throw's log line out of syslog
  Json::Value untouched;
  try {
    ParseFile(dir.Path("missing"), Json::Value(), untouched);
    FAIL() << "no Error";
  } catch (const orvane::Error& e) {
    EXPECT_EQ(e.code, orvane::kErrSystem);
    EXPECT_NE(std::string(e.what()).find("No such file or directory"), std::string::npos);
  }
  EXPECT_TRUE(untouched.isNull());
}

}  // namespace
}  // namespace CONTENT_EXTRACT
}  // namespace QUIX
