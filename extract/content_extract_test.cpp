#include "extract/content_extract.hpp"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include "common/error.hpp"
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
  EXPECT_FALSE(doc.isMember("stale"));
  EXPECT_EQ(doc[QUIXMDPath].asString(), file);
  EXPECT_EQ(doc[QUIXMDFSName].asString(), "Report.Final.PDF");
  EXPECT_EQ(doc[QUIXMDParent].asString(), dir.Path("docs"));
  EXPECT_FALSE(doc[QUIXMDIsDir].asBool());
  EXPECT_EQ(doc[QUIXMDFSSize].asInt64(), 5);
  EXPECT_EQ(doc[QUIXMDFSContentChangeDate].asInt64(), st.st_mtime);
  EXPECT_EQ(doc[QUIXMDAttributeChangeDate].asInt64(), st.st_ctime);
  if (doc.isMember(QUIXMDFSCreationDate)) {
    EXPECT_LE(doc[QUIXMDFSCreationDate].asInt64(), st.st_ctime);
  }
  EXPECT_EQ(doc[QUIXMDOwnerUserID].asString(), "1234");
  EXPECT_EQ(doc[QUIXMDOwnerGroupID].asString(), "567");
  EXPECT_EQ(doc[QUIXMDExtension].asString(), "pdf");

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

  orvane::test::LogCapture log;
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
