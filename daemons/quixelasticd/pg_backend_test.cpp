// The daemon itself on a PostgreSQL database of the test's own: two file servers sharing it,
// and the database going away in the middle of a load.
#include <pwd.h>
#include <signal.h>
#include <sys/stat.h>

#include <set>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "common/json_util.hpp"
#include "common/wire.hpp"
#include "test/engine_client.hpp"
#include "test/pg_server.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace elasticd {
namespace {

using tc::Cmd;
using tc::OnIndex;
using tc::Request;

class SharedDatabaseTest : public ::testing::Test {
 protected:
  std::unique_ptr<tc::DaemonProcess> Launch(const test::TempDir& root, const std::string& name) {
    ::chmod(root.path().c_str(), 0755);
    auto d = std::make_unique<tc::DaemonProcess>(
        root.path(),
        std::vector<std::string>{"--postgres", db_.conninfo(), "--server-name", name});
    EXPECT_TRUE(d->WaitReady());
    Json::Value r = OnIndex("index_create");
    r["data"]["path"] = root.Path("db");
    r["data"]["mappings"] = tc::FileMappings();
    EXPECT_EQ(Request(d->socket(), r)["success"], true) << JsonToString(r);
    return d;
  }

  static Json::Value Search(const std::string& name, const std::string& servers) {
    Json::Value data;
    data["name"] = name;
    data["size"] = 100;
    if (!servers.empty()) data["servers"] = servers;
    return Cmd("search", data);
  }

  // "server:path" of each hit.
  static std::set<std::string> Hits(const Json::Value& reply) {
    std::set<std::string> out;
    for (const Json::Value& h : reply["data"]["hits"]) {
      out.insert(h["server"].asString() + ":" + h["path"].asString());
    }
    return out;
  }

  static Json::Value Commit(const std::string& socket) {
    return Request(socket, OnIndex("commit"));
  }

  test::PgServer db_;
  test::TempDir a_root_, b_root_;
};

// Each server writes its own index (the same id on both: they stay two indexes), finds the
// other's files when it asks for every server, and only its own otherwise. Someone other
// than root sees only what this server's permission check can decide: its own files.
TEST_F(SharedDatabaseTest, EachServerFindsTheOthersFilesAndKeepsItsOwnPermissions) {
  auto alpha = Launch(a_root_, "alpha");
  auto beta = Launch(b_root_, "beta");
  const std::string alpha_file = a_root_.Write("share/alpha-report.txt", "x");
  ASSERT_EQ(Request(alpha->socket(), tc::Upsert(alpha_file))["success"], true);
  ASSERT_EQ(Request(beta->socket(), tc::Upsert("/volume1/share/beta-report.txt"))["success"],
            true);
  ASSERT_EQ(Commit(alpha->socket())["success"], true);
  ASSERT_EQ(Commit(beta->socket())["success"], true);

  const std::set<std::string> both = {"alpha:" + alpha_file,
                                      "beta:/volume1/share/beta-report.txt"};
  EXPECT_EQ(Hits(Request(alpha->socket(), Search("report", "all"))), both);
  EXPECT_EQ(Hits(Request(beta->socket(), Search("report", "all"))), both);
  const Json::Value own = Request(alpha->socket(), Search("report", ""));
  ASSERT_EQ(own["data"]["hits"].size(), 1u) << JsonToString(own);
  EXPECT_EQ(own["data"]["hits"][0]["path"], alpha_file);
  EXPECT_EQ(Request(alpha->socket(), Search("report", "some"))["error"]["code"],
            kCodeInvalidParam);

  const passwd* nobody = ::getpwnam("nobody");
  ASSERT_NE(nobody, nullptr);
  ::chmod(a_root_.Path("share").c_str(), 0755);
  const Json::Value theirs = tc::RequestAs(alpha->public_socket(), Search("report", "all"),
                                           nobody->pw_uid, nobody->pw_gid);
  EXPECT_EQ(Hits(theirs), std::set<std::string>{"alpha:" + alpha_file}) << JsonToString(theirs);

  // Deleting one server's index leaves the other's alone.
  ASSERT_EQ(Request(alpha->socket(), OnIndex("index_delete"))["success"], true);
  EXPECT_EQ(Hits(Request(beta->socket(), Search("report", "all"))),
            std::set<std::string>{"beta:/volume1/share/beta-report.txt"});
}

// Batches sent while the database is down are answered with the storage code, which tells the
// indexer to keep them and send them again; once it is back they land, each document once.
TEST_F(SharedDatabaseTest, ADatabaseRestartInTheMiddleOfALoadLosesAndDoublesNothing) {
  auto alpha = Launch(a_root_, "alpha");
  constexpr int kBatches = 12;
  constexpr int kPerBatch = 50;
  int refused = 0;
  for (int b = 0; b < kBatches; ++b) {
    if (b == 5) db_.Stop(SIGQUIT);  // as a crash of the database server would
    std::vector<Json::Value> upserts;
    for (int i = 0; i < kPerBatch; ++i) {
      upserts.push_back(
          tc::Upsert("/v/share/b" + std::to_string(b) + "/f" + std::to_string(i) + ".txt"));
    }
    upserts.push_back(OnIndex("commit"));
    for (int attempt = 0;; ++attempt) {
      ASSERT_LT(attempt, 50) << "batch " << b << " never landed";
      const Json::Value reply = Request(alpha->socket(), tc::Compound(upserts));
      if (reply["has_fail"] == false) break;
      EXPECT_EQ(reply["data"][0]["error"]["code"], kCodeStorage) << JsonToString(reply);
      if (++refused == 3) db_.Start();
    }
  }
  EXPECT_GE(refused, 3);
  Json::Value q = OnIndex("document_get_by_query");
  q["data"]["query"]["qsl"]["prefix"]["QUIXMDPath"] = "/v/share/";
  q["data"]["query"]["size"] = 10000;
  const Json::Value all = Request(alpha->socket(), q);
  std::set<std::string> paths;
  for (const Json::Value& d : all["data"]) paths.insert(d["QUIXMDPath"].asString());
  EXPECT_EQ(all["data"].size(), static_cast<Json::ArrayIndex>(kBatches * kPerBatch));
  EXPECT_EQ(paths.size(), static_cast<size_t>(kBatches * kPerBatch));
}

}  // namespace
}  // namespace elasticd
}  // namespace orvane
