#include "tools/fileindexctl/spotlight_conf.hpp"

#include <sys/stat.h>

#include <gtest/gtest.h>

#include "common/error.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace ctl {
namespace {

TEST(SpotlightConfTest, MergeReplacesOurKeysInTheTwoSectionsAndKeepsEverythingElse) {
  SpotlightSettings s;
  s.share = "Docs";
  s.port = 9300;
  s.mappings = "/m.json";
  const std::string conf =
      "# site settings\n"
      "[global]\n"
      "\tworkgroup = HOME\n"
      "\tElasticSearch:Mappings = /old.json\n"
      "[docs]\n"
      "\tpath = /srv/docs\n"
      "\tspotlight=no\n"
      "\telasticsearch:index = old \\\n"
      "\t\tcontinued\n"
      "; spotlight = no stays a comment\n"
      "[other]\n"
      "\tspotlight = no\n";
  EXPECT_EQ(MergeSpotlightConf(conf, "/etc/samba/smb.conf", s),
            "# site settings\n"
            "[global]\n"
            "\telasticsearch:mappings = /m.json\n"
            "\tworkgroup = HOME\n"
            "[docs]\n"
            "\tspotlight = yes\n"
            "\tspotlight backend = elasticsearch\n"
            "\telasticsearch:address = 127.0.0.1\n"
            "\telasticsearch:port = 9300\n"
            "\telasticsearch:index = fileindex_Docs\n"
            "\tpath = /srv/docs\n"
            "; spotlight = no stays a comment\n"
            "[other]\n"
            "\tspotlight = no\n");

  // No [global]: one is added at the top. No section for the share: refused, naming the file.
  EXPECT_EQ(MergeSpotlightConf("[docs]\n", "f", s).substr(0, 45),
            "[global]\n\telasticsearch:mappings = /m.json\n\n[");
  try {
    MergeSpotlightConf("[global]\n", "/x/smb.conf", s);
    ADD_FAILURE() << "merged without the share";
  } catch (const Error& e) {
    EXPECT_NE(std::string(e.what()).find("/x/smb.conf has no section [Docs]"), std::string::npos);
  }
}

TEST(SpotlightConfTest, WritingReplacesTheFileWithItsModeKept) {
  test::TempDir dir;
  const std::string path = dir.Write("smb.conf", "[share]\n\tpath = /srv\n");
  ASSERT_EQ(::chmod(path.c_str(), 0640), 0);
  SpotlightSettings s;
  s.share = "share";
  WriteSpotlightConf(path, s);
  struct stat st;
  ASSERT_EQ(::stat(path.c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0640u);
  EXPECT_NE(test::ReadFile(path).find("elasticsearch:port = 9210\n"), std::string::npos);
  EXPECT_THROW(WriteSpotlightConf(dir.Path("missing.conf"), s), Error);
}

}  // namespace
}  // namespace ctl
}  // namespace orvane
