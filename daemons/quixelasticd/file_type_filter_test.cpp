// A search by kind and the folders' content switches must decide a file's kind alike: a search
// for photos finds exactly the files whose extraction the photo switch turns on and off.
#include <sys/stat.h>

#include <gtest/gtest.h>

#include <set>
#include <string>
#include <vector>

#include "common/json_util.hpp"
#include "daemons/quixelasticd/engine.hpp"
#include "extract/content_extract.hpp"
#include "fileindex/folder_mgr.hpp"
#include "test/admin_env.hpp"
#include "test/engine_client.hpp"

namespace orvane {
namespace elasticd {
namespace {

using Paths = std::set<std::string>;

class FileTypeFilterTest : public fileindex::testenv::AdminTestEnv {
 protected:
  void SetUp() override {
    AdminTestEnv::SetUp();
    EngineOptions options;
    options.registry_file = scratch_.Path("engine/indexes.json");
    options.running_marker = scratch_.Path("engine/running");
    engine_ = std::make_unique<Engine>(options);
    engine_->Start();
    engine_->WaitOpened();
    Json::Value create = tc::OnIndex("index_create");
    create["data"]["path"] = scratch_.Path("db");
    create["data"]["mappings"] = tc::FileMappings();
    create["data"]["event_handler"]["lib_path"] = "/handler.so";
    ASSERT_TRUE(Send(create)["success"].asBool());
  }

  Json::Value Send(const Json::Value& request) { return engine_->HandleValue(request, root_); }

  // Indexes `path` with the fields the library sends for a file whose contents are not asked for.
  void Index(const std::string& path) {
    Json::Value data;
    data["id"] = "fileindex_share";
    data["doc_id"] = path;
    QUIX::CONTENT_EXTRACT::ParseFile(path, Json::Value(), data["data"]);
    ASSERT_TRUE(Send(tc::Cmd("document_upsert_by_id", data))["success"].asBool()) << path;
  }

  Paths Found(const std::string& query) {
    const Json::Value reply = Send(tc::Cmd("search", tc::Parse(query)));
    EXPECT_TRUE(reply["success"].asBool()) << query << JsonToString(reply);
    Paths paths;
    for (const Json::Value& hit : reply["data"]["hits"]) paths.insert(hit["path"].asString());
    return paths;
  }

  Caller root_{0, 0, true};
  std::unique_ptr<Engine> engine_;
};

TEST_F(FileTypeFilterTest, ASearchByKindFindsWhatThatKindsSwitchGoverns) {
  // Among them names whose kind the search once decided from a list of its own.
  const std::vector<std::string> names = {
      "a.jpe",  "b.JPG", "c.heic",   "d.webp", "e.svg",  "f.opus", "g.oga", "h.Mp3",
      "i.webm", "j.ts",  "k.dvr-ms", "l.pdf",  "README", "m.json", "n.7z",  "o.zzqq"};
  std::vector<std::string> paths;
  for (const std::string& name : names) paths.push_back(volume_.Write("music/" + name, "x"));
  for (const std::string& path : paths) Index(path);
  // A folder's contents are never read, so it is of no kind whatever its name.
  ASSERT_EQ(mkdir((vol_ + "/music/trips.jpg").c_str(), 0755), 0);
  Index(vol_ + "/music/trips.jpg");

  const char* const kinds[] = {"document", "audio", "video", "photo"};
  for (int k = 0; k < 4; ++k) {
    // The kind's switch governs a file when it alone decides whether the contents are read.
    WriteFolders({FolderJson("/music", "only", k == 0, k == 1, k == 2, k == 3)});
    const fileindex::FolderMgr only;
    WriteFolders({FolderJson("/music", "all but", k != 0, k != 1, k != 2, k != 3)});
    const fileindex::FolderMgr all_but;
    Paths governed;
    for (const std::string& path : paths) {
      if (only.IsFullPathNeedMeta(path) && !all_but.IsFullPathNeedMeta(path)) {
        governed.insert(path);
      }
    }
    EXPECT_EQ(Found(std::string(R"({"size": 1000, "file_type": ")") + kinds[k] + "\"}"),
              governed)
        << kinds[k];
  }
  const std::string music = vol_ + "/music/";
  EXPECT_EQ(Found(R"({"file_type": "photo", "ext": ["heic", "JPE", "jpg"]})"),
            (Paths{music + "a.jpe", music + "b.JPG", music + "c.heic"}));
  // Extensions of another kind leave nothing, not the files without an extension.
  EXPECT_EQ(Found(R"({"file_type": "photo", "ext": "pdf"})"), Paths());
}

}  // namespace
}  // namespace elasticd
}  // namespace orvane
