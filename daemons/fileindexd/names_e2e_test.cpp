// Names that are not UTF-8, as old Latin-1 clients leave them on a share, through the whole
// system with the real daemons: the crawl, the watcher, renames and deletes reach the index
// with the real bytes, the valid parts of a name find it, and every JSON text that fileindexctl
// prints or the administration files hold is strict UTF-8.
#include <gtest/gtest.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <set>

#include "common/json_util.hpp"
#include "common/name_codec.hpp"
#include "common/root.hpp"
#include "fileindex/folder_mgr.hpp"
#include "fileindex/index_mgr.hpp"
#include "test/daemon_system.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace fileindexd {
namespace {

using test::WriteFile;

using CtlResult = orvane::test::ProgramResult;

// Runs fileindexctl with these arguments, bytes as given, under the test's ORVANE_ROOT.
CtlResult Ctl(const std::vector<std::string>& args) {
  return orvane::test::RunProgram(FILEINDEXCTL_BIN, args);
}

// Whether a strict outside parser takes `text` as JSON: the bytes decoded as UTF-8 with no
// leniency, then parsed.
bool StrictJson(const std::string& text) {
  orvane::test::TempDir dir;
  const std::string path = dir.Write("text.json", text);
  return std::system(("/usr/bin/python3 -c 'import json, sys; "
                      "json.loads(sys.stdin.buffer.read().decode(\"utf-8\", \"strict\"))' < " +
                      path)
                         .c_str()) == 0;
}

// Every entry below `root`, and `root`, as the disk names them.
std::set<std::string> Disk(const std::string& root) {
  std::set<std::string> out = {root};
  for (const auto& entry : std::filesystem::recursive_directory_iterator(root)) {
    out.insert(entry.path().string());
  }
  return out;
}

class NamesEndToEndTest : public test::RunningSystemTest {
 protected:
  NamesEndToEndTest() : RunningSystemTest({"docs"}) {}

  void ExpectSettled(const std::string& root) {
    test::WaitFor([&] { return sys_.Documents("docs") == Disk(root); }, 30000);
    EXPECT_EQ(sys_.Documents("docs"), Disk(root));
  }

  // fileindexctl's JSON output, checked by the strict parser, then read by ours.
  Json::Value CtlJson(std::vector<std::string> args) {
    args.insert(args.begin(), "--json");
    const CtlResult run = Ctl(args);
    EXPECT_EQ(run.status, 0) << testing::PrintToString(args) << run.err;
    EXPECT_TRUE(StrictJson(run.out)) << testing::PrintToString(args) << "\n" << run.out;
    JsonValue value;
    EXPECT_TRUE(value.fromString(run.out)) << run.out;
    return std::move(value);
  }
};

TEST_F(NamesEndToEndTest, NamesThatAreNotUtf8AreIndexedFoundRenamedAndDeleted) {
  // The indexed folder itself is named in Latin-1, so the folder and status files carry it.
  const std::string folder = sys_.Vol("docs/l\xE9gacy");
  WriteFile(folder + "/caf\xE9 menu.txt", "the daily menu");
  WriteFile(folder + "/\xFF\xFEreport.pdf", "r");
  WriteFile(folder + "/dir\xFF/inner.txt", "i");
  WriteFile(folder + "/plain.txt", "p");
  Json::Value add(Json::arrayValue);
  add.append(test::System::Folder("/docs/l\xE9gacy", true));
  fileindex::FolderAdd(add, false);
  ExpectSettled(folder);

  // The watcher's events: a new file, a file and a folder renamed, a file deleted.
  WriteFile(folder + "/new\xE9.txt", "n");
  ASSERT_EQ(0, rename((folder + "/caf\xE9 menu.txt").c_str(),
                      (folder + "/caf\xE9 carte.txt").c_str()));
  ASSERT_EQ(0, rename((folder + "/dir\xFF").c_str(), (folder + "/dir\xFE").c_str()));
  ASSERT_EQ(0, unlink((folder + "/\xFF\xFEreport.pdf").c_str()));
  ExpectSettled(folder);

  // Found by the valid part of the name and by the same bytes typed on the command line, with
  // the real bytes in the reply.
  for (const std::string& name : {std::string("carte"), std::string("\xE9 c")}) {
    const Json::Value res = CtlJson({"search", "--name", name});
    ASSERT_EQ(res["hits"].size(), 1u) << res;
    EXPECT_EQ(res["hits"][0]["path"].asString(), folder + "/caf\xE9 carte.txt");
    EXPECT_EQ(res["hits"][0]["name"].asString(), "caf\xE9 carte.txt");
  }
  const Json::Value inner = CtlJson({"search", "--folder", folder + "/dir\xFE", "--name", "inn"});
  ASSERT_EQ(inner["hits"].size(), 1u) << inner;
  EXPECT_EQ(inner["hits"][0]["path"].asString(), folder + "/dir\xFE/inner.txt");
  const Json::Value words = CtlJson({"search", "menu"});
  ASSERT_EQ(words["hits"].size(), 1u) << words;
  EXPECT_NE(words["hits"][0]["snippet"].asString().find("<b>menu</b>"), std::string::npos);
  CtlJson({"suggest", "car"});
  const Json::Value listed = CtlJson({"folder", "list"});
  ASSERT_EQ(listed["folders"].size(), 1u);
  EXPECT_EQ(listed["folders"][0]["path"].asString(), "/docs/l\xE9gacy");
  EXPECT_EQ(CtlJson({"folder", "get", "/docs/l\xE9gacy"})["name"].asString(), "l\xE9gacy");
  CtlJson({"status"});
  const std::string folders_file = RootedPath(fileindex::kFileIndexFoldersCfgPath);
  EXPECT_TRUE(StrictJson(orvane::test::ReadFile(folders_file)));

  // People see U+FFFD for each byte that is not text, in tables and in failure messages.
  const CtlResult human = Ctl({"search", "--name", "carte"});
  EXPECT_TRUE(IsValidUtf8(human.out)) << human.out;
  EXPECT_NE(human.out.find("caf\xEF\xBF\xBD carte.txt"), std::string::npos) << human.out;
  EXPECT_NE(human.out.find("l\xEF\xBF\xBDgacy"), std::string::npos) << human.out;
  const CtlResult missing = Ctl({"folder", "get", "/docs/l\xE9gacy-gone"});
  EXPECT_EQ(missing.status, 1);
  EXPECT_TRUE(IsValidUtf8(missing.err)) << missing.err;
  EXPECT_NE(missing.err.find("l\xEF\xBF\xBDgacy-gone"), std::string::npos) << missing.err;
}

}  // namespace
}  // namespace fileindexd
}  // namespace orvane
