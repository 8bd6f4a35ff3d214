// A scratch system for the tests of the folder configuration and the administration
// operations: its own ORVANE_ROOT, a volume folder with the shares "photo", "music", "homes",
// "ro" (read-only) and "Photos" (a name that differs from "photo" only in case), the platform
// file naming them, and helpers to read and write the files the operations keep.
#ifndef ORVANE_TEST_ADMIN_ENV_HPP_
#define ORVANE_TEST_ADMIN_ENV_HPP_

#include <gtest/gtest.h>
#include <json/json.h>

#include <algorithm>
#include <cstdio>
#include <memory>
#include <string>
#include <vector>

#include "common/error.hpp"
#include "common/json_util.hpp"
#include "common/root.hpp"
#include "common/util.hpp"
#include "fileindex/folder_mgr.hpp"
#include "platform/monitor_queue.hpp"
#include "test/fake_daemon.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace fileindex {
namespace testenv {

using Strings = std::vector<std::string>;

class AdminTestEnv : public ::testing::Test {
 protected:
  void SetUp() override {
    vol_ = volume_.path();
    for (const char* dir : {"photo/trips/2024", "photo/family", "photo/#recycle", "music/live",
                            "homes/bob/docs", "homes/bobby", "ro/x", "Photos/a"}) {
      ASSERT_TRUE(MakeParentDirs(vol_ + "/" + dir + "/x"));
    }
    actions_ = scratch_.Path("actions");
    WritePlatform(DefaultShares());
  }

  // The shares of the scratch volume, as the platform file lists them.
  std::string DefaultShares() const {
    return R"(
      {"name": "photo", "path": ")" +
           vol_ + R"(/photo", "recycle_bin": true},
      {"name": "music", "path": ")" +
           vol_ + R"(/music"},
      {"name": "homes", "path": ")" +
           vol_ + R"(/homes", "recycle_bin": true},
      {"name": "ro", "path": ")" +
           vol_ + R"(/ro", "readonly": true},
      {"name": "Photos", "path": ")" +
           vol_ + R"(/Photos"})";
  }
  // Writes the platform file with `shares` (the text of the array's elements).
  void WritePlatform(const std::string& shares) {
    const std::string record = R"(["/bin/sh", "-c", "echo $0 >> )" + actions_ + R"(", )";
    test::WritePlatformConfig(root_.path(), R"({
    "samba_conf": ")" + scratch_.Path("smb.conf") +
                                                R"(",
    "services": {
      "quixcontentextractd": {"start": )" + record +
                                                R"("start-ce"]},
      "pkg-Orvane-fileindexd": {"start": )" + record +
                                                R"("start-fi"], "stop": )" + record +
                                                R"("stop-fi"]},
      "samba": {"restart": )" + record + R"("restart-smb"]}
    },
    "shares": [)" + shares + "]}");
  }

  std::string Rooted(const std::string& fixed) const { return root_.path() + fixed; }
  std::string FoldersPath() const { return Rooted(kFileIndexFoldersCfgPath); }
  void WriteFolders(const std::vector<Json::Value>& folders) {
    Json::Value list(Json::arrayValue);
    for (const auto& f : folders) list.append(f);
    ASSERT_TRUE(JsonValue(list).toFile(FoldersPath()));
  }
  // Puts `text` in place of the file at `path` whole, the way an editor saves it.
  void ReplaceFile(const std::string& path, const std::string& text) {
    ASSERT_TRUE(MakeParentDirs(path));
    volume_.Write("replacement", text);
    ASSERT_EQ(rename(volume_.Path("replacement").c_str(), path.c_str()), 0);
  }
  std::string Queue(const std::string& share) const {
    return vol_ + "/" + share + "/@eaDir/@fileindex/queue";
  }

  static Json::Value Parse(const std::string& text) {
    JsonValue v;
    EXPECT_TRUE(v.fromString(text)) << text;
    return std::move(v);
  }
  Json::Value ReadJson(const std::string& path) const { return Parse(test::ReadFile(path)); }
  // The lines of a queue file, parsed.
  std::vector<Json::Value> QueueLines(const std::string& share) const {
    std::vector<Json::Value> lines;
    const std::string text = test::ReadFile(Queue(share));
    size_t pos = 0;
    while (pos < text.size()) {
      const size_t nl = text.find('\n', pos);
      EXPECT_NE(nl, std::string::npos) << "unterminated queue line";
      if (nl == std::string::npos) break;
      lines.push_back(Parse(text.substr(pos, nl - pos)));
      pos = nl + 1;
    }
    return lines;
  }

  // The queue lines of a share as "<event> <path below the volume> <data>".
  Strings Events(const std::string& share) const {
    Strings out;
    for (const Json::Value& e : QueueLines(share)) {
      std::string line =
          std::to_string(e["event"].asUInt()) + " " + e["path"].asString().substr(vol_.size());
      if (!e["path_old"].asString().empty()) {
        line += " <- " + e["path_old"].asString().substr(vol_.size());
      }
      if (!e["data"].isNull()) line += " " + JsonToString(e["data"]);
      out.push_back(line);
    }
    return out;
  }
  // A folder record as a request or the folder file holds it.
  static Json::Value FolderJson(const std::string& path, const std::string& name, bool document,
                                bool audio, bool video, bool photo) {
    Json::Value f(Json::objectValue);
    f["path"] = path;
    f["name"] = name;
    f["document"] = document;
    f["audio"] = audio;
    f["video"] = video;
    f["photo"] = photo;
    return f;
  }

  // In-test indexing daemon and search engine on their real socket paths, each recording what
  // it receives and answering success.
  void StartDaemons() {
    // The old ones first: a daemon removes its socket file when it goes.
    indexd_.reset();
    engine_.reset();
    indexd_ = std::make_unique<test::FakeDaemon>(Rooted("/var/run/fileindexd.sock"),
                                                 test::FakeDaemon::Replies({"{}"}));
    indexd_seen_ = 0;
    engine_ = std::make_unique<test::FakeDaemon>(
        Rooted("/var/run/quixelasticd.sock"), test::FakeDaemon::Replies({R"({"success":true})"}));
    engine_seen_ = 0;
  }
  // Replaces the engine with one that gives `replies` in turn (the last one repeated).
  void StartEngine(std::vector<std::string> replies) {
    engine_.reset();
    engine_ = std::make_unique<test::FakeDaemon>(Rooted("/var/run/quixelasticd.sock"),
                                                 test::FakeDaemon::Replies(std::move(replies)));
    engine_seen_ = 0;
  }
  // The indexing daemon's commands as compact {"type", "data"} texts, in order.
  std::vector<std::string> IndexdCommands() const {
    std::vector<std::string> out;
    for (const Json::Value& r : indexd_->json_requests()) out.push_back(JsonToString(r));
    return out;
  }
  // The engine's requests as "<command> <data.id>", in order.
  std::vector<std::string> EngineCommands() const {
    std::vector<std::string> out;
    for (const Json::Value& r : engine_->json_requests()) {
      out.push_back(r["command"].asString() + " " + r["data"]["id"].asString());
    }
    return out;
  }
  std::vector<Json::Value> EngineRequests() const { return engine_->json_requests(); }
  // What reached each daemon since the last look.
  Strings NewEngine() { return Since(EngineCommands(), engine_seen_); }
  Strings NewIndexd() { return Since(IndexdCommands(), indexd_seen_); }
  static Strings Since(const Strings& all, size_t& seen) {
    Strings out(all.begin() + seen, all.end());
    seen = all.size();
    return out;
  }

  // The services started, stopped and restarted, one per line.
  std::string Actions() const { return test::ReadFile(actions_); }

  test::TempDir root_;
  test::TempDir volume_;
  test::TempDir scratch_;
  std::string actions_;
  std::unique_ptr<test::FakeDaemon> indexd_;
  std::unique_ptr<test::FakeDaemon> engine_;
  size_t indexd_seen_ = 0;
  size_t engine_seen_ = 0;
  test::ScopedRoot scoped_{root_.path()};
  std::string vol_;
};

// The same with the fake daemons running and views of what the operations left behind.
class AdminOpsTest : public AdminTestEnv {
 protected:
  void SetUp() override {
    AdminTestEnv::SetUp();
    StartDaemons();
  }
  Json::Value Folders() const { return ReadJson(FoldersPath()); }
  // The folder file's "paused" members, in order.
  std::vector<bool> Paused() const {
    std::vector<bool> paused;
    for (const auto& f : Folders()) paused.push_back(f["paused"].asBool());
    return paused;
  }
  // The paths of the folder file, in order.
  Strings FolderPaths() const {
    Strings paths;
    for (const auto& f : Folders()) paths.push_back(f["path"].asString());
    return paths;
  }
  // Each registered queue's share and the folders it watches, as "share: path path".
  Strings Registrations() const {
    Strings out;
    for (const Json::Value& r : QUIX::QUIXNOTIFYD::MonitorQueue::List()) {
      std::string line = r["queue"].asString().substr(vol_.size() + 1);
      line = line.substr(0, line.find('/')) + ":";
      for (const auto& c : r["config"]) line += " " + c["path"].asString().substr(vol_.size());
      out.push_back(line);
    }
    std::sort(out.begin(), out.end());
    return out;
  }
  static std::string Notify(const std::string& share, bool upsert) {
    return R"({"data":{"is_upsert":)" + std::string(upsert ? "true" : "false") +
           R"(,"share_name":")" + share + R"("},"type":"notify_setting_changed"})";
  }
  static std::string Worker(const std::string& type, const std::string& share) {
    return R"({"data":{"share_name":")" + share + R"("},"type":")" + type + R"("})";
  }
  static Json::Value List(std::vector<Json::Value> folders) {
    Json::Value list(Json::arrayValue);
    for (auto& f : folders) list.append(f);
    return list;
  }
  static constexpr const char* kAll = R"({"audio":true,"document":true,"photo":true,"video":true})";
};

using test::ErrorOf;

}  // namespace testenv
}  // namespace fileindex
}  // namespace orvane

#endif  // ORVANE_TEST_ADMIN_ENV_HPP_
