// The daemon binary itself, through its real sockets: framing, signals, crashes and the
// identity of callers (root and nobody).
#include <linux/sockios.h>
#include <poll.h>
#include <pwd.h>
#include <signal.h>
#include <sys/ioctl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>

#include <chrono>
#include <cstring>
#include <thread>
#include <tuple>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "common/fd.hpp"
#include "common/json_util.hpp"
#include "common/util.hpp"
#include "common/wire.hpp"
#include "test/engine_client.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace elasticd {
namespace {

using tc::Cmd;
using tc::Eventually;
using tc::OnIndex;
using tc::Request;

// Upserts of <dir>/file<first>.txt and on, in one compound request.
Json::Value Batch(const std::string& dir, int first, int count) {
  std::vector<Json::Value> upserts;
  for (int i = first; i < first + count; ++i) {
    upserts.push_back(tc::Upsert(dir + "/file" + std::to_string(i) + ".txt"));
  }
  return tc::Compound(upserts);
}

// A connection to a Unix socket that gives up after `timeout_s` for connecting and each read.
UniqueFd Connect(const std::string& socket, int timeout_s) {
  UniqueFd fd = wire::Connect(socket, timeout_s * 1000);
  struct timeval tv = {timeout_s, 0};
  ::setsockopt(fd.get(), SOL_SOCKET, SO_RCVTIMEO, &tv, sizeof(tv));
  return fd;
}

class DaemonTest : public ::testing::Test {
 protected:
  void SetUp() override { ::chmod(dir_.path().c_str(), 0755); }

  void Launch(std::vector<std::string> args = {}) {
    daemon_ = std::make_unique<tc::DaemonProcess>(dir_.path(), std::move(args));
    ASSERT_TRUE(daemon_->WaitReady());
    // After a restart the indexes open (and, after a crash, are checked) in the background;
    // until then they answer 607 or 608, which the library waits out the same way.
    ASSERT_TRUE(Eventually([&] {
      // The reply is kept in a local: a range over a member of a temporary would dangle.
      const Json::Value list = Send(Cmd("index_list", Json::Value()));
      for (const Json::Value& index : list["data"]) {
        const std::string state = index["state"].asString();
        if (state == "opening" || state == "recovering") return false;
      }
      return true;
    })) << "indexes did not open";
  }
  Json::Value Send(const Json::Value& req) { return Request(daemon_->socket(), req); }
  Json::Value CreateIndex() {
    Json::Value r = OnIndex("index_create");
    r["data"]["path"] = dir_.Path("db");
    r["data"]["mappings"] = tc::FileMappings();
    return Send(r);
  }
  int64_t Count(const std::string& prefix) {
    Json::Value r = OnIndex("document_get_by_query");
    r["data"]["query"]["qsl"]["prefix"]["QUIXMDPath"] = prefix;
    r["data"]["query"]["size"] = 10000;
    return static_cast<int64_t>(Send(r)["data"].size());
  }

  orvane::test::TempDir dir_;
  std::unique_ptr<tc::DaemonProcess> daemon_;
};

// An announced length over the limit is answered without reading it; eight clients at once
// each get their own replies.
TEST_F(DaemonTest, OversizedFramesAreRefusedAndConcurrentClientsServed) {
  Launch({"--max-frame-bytes", "4096"});
  const std::string reply = tc::RawExchange(daemon_->socket(), tc::Frame(std::string(5000, ' ')));
  EXPECT_EQ(tc::Parse(std::string(wire::PayloadText(reply)))["error"]["code"], kCodeTooLarge);
  ASSERT_EQ(CreateIndex()["success"], true);
  std::vector<std::thread> threads;
  std::atomic<int> ok{0};
  for (int t = 0; t < 8; ++t) {
    threads.emplace_back([&, t] {
      for (int i = 0; i < 5; ++i) {
        if (Send(Batch("/v/share/t" + std::to_string(t), i * 3, 3))["has_fail"] == false) ++ok;
      }
    });
  }
  for (std::thread& t : threads) t.join();
  EXPECT_EQ(ok.load(), 40);
  EXPECT_EQ(Count("/v/share/"), 120);
}

TEST_F(DaemonTest, AnswersBusyBeyondTheMemoryLimitAndRecovers) {
  Launch({"--memory-limit-mb", "1"});
  Json::Value big = Cmd("index_list", Json::Value());
  big["padding"] = std::string(400 * 1024, 'x');  // counted four times: over the 1 MiB limit
  const Json::Value refused = Send(big);
  EXPECT_EQ(refused["error"]["code"], kCodeOutOfMemory) << JsonToString(refused);
  EXPECT_EQ(Send(Cmd("index_list", Json::Value()))["success"], true);
}

TEST_F(DaemonTest, SigtermStopsCleanly) {
  Launch();
  ASSERT_EQ(CreateIndex()["success"], true);
  ASSERT_EQ(Send(Batch("/v/share", 0, 10))["has_fail"], false);
  EXPECT_TRUE(IsFileExist(dir_.Path("var/run/quixelasticd.pid")));
  const int status = daemon_->Signal(SIGTERM);
  ASSERT_TRUE(WIFEXITED(status));
  EXPECT_EQ(WEXITSTATUS(status), 0);
  EXPECT_FALSE(IsFileExist(dir_.Path("var/run/quixelasticd.pid")));
  EXPECT_FALSE(IsFileExist(dir_.Path("var/run/quixelasticd.sock")));
  EXPECT_FALSE(IsFileExist(dir_.Path("var/lib/quixelasticd/running")));
  Launch();
  EXPECT_EQ(Count("/v/share/"), 10);
}

TEST_F(DaemonTest, RunsAsAServiceWithAPidFile) {
  const pid_t launcher = ::fork();
  if (launcher == 0) {
    ::setenv("ORVANE_ROOT", dir_.path().c_str(), 1);
    ::execl(QUIXELASTICD_BINARY, QUIXELASTICD_BINARY, "--service-user", "nobody-such-account",
            static_cast<char*>(nullptr));
    _exit(127);
  }
  int status = 0;
  ASSERT_EQ(::waitpid(launcher, &status, 0), launcher);
  ASSERT_EQ(status, 0);  // the parent returns at once
  const std::string pid_file = dir_.Path("var/run/quixelasticd.pid");
  pid_t pid = 0;
  ASSERT_TRUE(Eventually([&] {
    return (pid = static_cast<pid_t>(std::atoi(orvane::test::ReadFile(pid_file).c_str()))) > 0;
  }));
  EXPECT_TRUE(Eventually([&] {
    return Request(dir_.Path("var/run/quixelasticd.sock"),
                   Cmd("index_list", Json::Value()))["success"]
        .asBool();
  }));
  // A second daemon on the same root refuses to start while the first holds the pid file.
  tc::DaemonProcess second(dir_.path());
  EXPECT_EQ(second.Signal(0), 1 << 8);
  ::kill(pid, SIGTERM);
  EXPECT_TRUE(Eventually([&] { return !IsFileExist(pid_file); }));
}

TEST_F(DaemonTest, KillNineLosesNothingCommittedAndNoBatchHalfWay) {
  Launch();
  ASSERT_EQ(CreateIndex()["success"], true);
  ASSERT_EQ(Send(Batch("/v/share/kept", 0, 500))["has_fail"], false);
  ASSERT_EQ(Send(OnIndex("commit"))["success"], true);
  daemon_->Signal(SIGKILL);
  Launch();
  EXPECT_EQ(Count("/v/share/kept/"), 500);

  // Killed while a large batch is being written: after the restart the batch is either wholly
  // there or wholly absent, and the index passed its check.
  const Json::Value big = Batch("/v/share/big", 0, 8000);
  std::thread writer([&] { Request(daemon_->socket(), big); });
  std::this_thread::sleep_for(std::chrono::milliseconds(300));
  daemon_->Signal(SIGKILL);
  writer.join();
  Launch();
  const int64_t big_count = Count("/v/share/big/");
  RecordProperty("big_count", static_cast<int>(big_count));
  EXPECT_TRUE(big_count == 0 || big_count == 8000) << big_count;
  EXPECT_EQ(Count("/v/share/kept/"), 500);
  const Json::Value list = Send(Cmd("index_list", Json::Value()));
  EXPECT_EQ(list["data"][0]["state"], "ready") << JsonToString(list);
}

// 400 idle connections of root to the public socket: the daemon keeps 16 of them and refuses
// the rest at once, answering as it accepts; the library's requests on the main socket and other
// users' searches are served meanwhile, and root's own places come back when it lets go.
TEST_F(DaemonTest, PublicFloodLeavesRoomForTheMainSocketAndOtherUsers) {
  const struct passwd* nobody = ::getpwnam("nobody");
  ASSERT_NE(nobody, nullptr);
  // The idle time-out is lengthened so that the held connections stay while they are counted.
  Launch({"--public-timeout-ms", "60000"});
  ASSERT_EQ(CreateIndex()["success"], true);
  const Json::Value search = tc::Parse(R"({"command": "search", "data": {"name": "flood"}})");
  std::vector<UniqueFd> flood;
  std::vector<struct pollfd> fds;
  for (int i = 0; i < 400; ++i) {
    flood.push_back(Connect(daemon_->public_socket(), 5));
    ASSERT_TRUE(flood.back().valid()) << i;
    fds.push_back({flood.back().get(), POLLIN, 0});
  }
  int refused = 0, closed = 0;
  const auto until = std::chrono::steady_clock::now() + std::chrono::seconds(10);
  while (refused + closed < 384 && std::chrono::steady_clock::now() < until) {
    if (::poll(fds.data(), fds.size(), 100) <= 0) continue;
    for (struct pollfd& p : fds) {
      if (p.fd < 0 || p.revents == 0) continue;
      char buf[4096];
      const ssize_t n = ::recv(p.fd, buf, sizeof(buf), 0);
      const std::string got(buf, n > 0 ? static_cast<size_t>(n) : 0);
      ++(got.find("\"code\":" + std::to_string(kCodeOverloaded)) != std::string::npos ? refused
                                                                                     : closed);
      p.fd = -1;
    }
  }
  EXPECT_EQ(refused, 384);
  EXPECT_EQ(closed, 0);
  const auto start = std::chrono::steady_clock::now();
  ASSERT_EQ(Send(tc::Upsert(dir_.Write("share/flood.txt", "x")))["success"], true);
  ::chmod(dir_.Path("share").c_str(), 0755);
  const Json::Value theirs =
      tc::RequestAs(daemon_->public_socket(), search, nobody->pw_uid, nobody->pw_gid);
  EXPECT_EQ(theirs["data"]["total"], 1) << JsonToString(theirs);
  // A bound that only keeps the test from passing after a retry-length stall.
  EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(5));
  const Json::Value mine = tc::Request(daemon_->public_socket(), search);
  EXPECT_EQ(mine["error"]["code"], kCodeOverloaded) << JsonToString(mine);
  EXPECT_THAT(mine["error"]["msg"].asString(),
              ::testing::HasSubstr("too many connections from uid 0"));
  flood.clear();
  EXPECT_TRUE(Eventually(
      [&] { return tc::Request(daemon_->public_socket(), search)["data"]["total"] == 1; }));
}

// Requests of one user begun on the public socket are capped; another user and the main socket
// are not held back by them.
TEST_F(DaemonTest, PublicRequestsInProgressAreCappedPerUser) {
  const struct passwd* nobody = ::getpwnam("nobody");
  ASSERT_NE(nobody, nullptr);
  Launch({"--public-timeout-ms", "60000", "--max-public-requests-per-user", "2"});
  const Json::Value search = tc::Parse(R"({"command": "search", "data": {"name": "abc"}})");
  // Two requests of root begun and never finished. Root asks again only once the daemon has
  // read both beginnings (nothing of them is left unread): a request of its own taking one of
  // the two places first would have the begun one refused instead.
  std::vector<UniqueFd> begun;
  for (int i = 0; i < 2; ++i) {
    begun.push_back(Connect(daemon_->public_socket(), 10));
    ASSERT_EQ(::send(begun.back().get(), "\x40\0\0\0", 4, MSG_NOSIGNAL), 4);
  }
  ASSERT_TRUE(Eventually([&] {
    int unread = -1;
    for (const UniqueFd& fd : begun) {
      if (::ioctl(fd.get(), SIOCOUTQ, &unread) != 0 || unread != 0) return false;
    }
    return true;
  }));
  const Json::Value refused = tc::Request(daemon_->public_socket(), search);
  EXPECT_THAT(refused["error"]["msg"].asString(),
              ::testing::HasSubstr("too many searches of uid 0"));
  EXPECT_EQ(
      tc::RequestAs(daemon_->public_socket(), search, nobody->pw_uid, nobody->pw_gid)["success"],
      true);
  EXPECT_EQ(Send(Cmd("index_list", Json::Value()))["success"], true);
  begun.clear();
  EXPECT_TRUE(Eventually(
      [&] { return tc::Request(daemon_->public_socket(), search)["success"].asBool(); }));
}

// A public connection that sends nothing, or half a request, is closed without an answer once
// its time is up; one that asks at once is answered.
TEST_F(DaemonTest, PublicSocketClosesIdleConnections) {
  Launch({"--public-timeout-ms", "300"});
  UniqueFd idle = Connect(daemon_->public_socket(), 10);
  UniqueFd half = Connect(daemon_->public_socket(), 10);
  ASSERT_TRUE(idle.valid() && half.valid());
  ASSERT_EQ(::send(half.get(), "\x40\0", 2, MSG_NOSIGNAL), 2);
  char c;
  EXPECT_EQ(::recv(idle.get(), &c, 1, 0), 0);
  EXPECT_EQ(::recv(half.get(), &c, 1, 0), 0);
  const Json::Value list = tc::Parse(R"({"command": "search", "data": {"name": "abc"}})");
  EXPECT_EQ(tc::Request(daemon_->public_socket(), list)["success"], true);
}

// Ordinary users only search, on the public socket, and see only what they could open; the
// share is reached through a link above it, as a volume may be, and its index lies in the share.
TEST_F(DaemonTest, OrdinaryUsersSearchOnlyWhatTheyCouldOpen) {
  const struct passwd* nobody = ::getpwnam("nobody");
  ASSERT_NE(nobody, nullptr);
  const uid_t uid = nobody->pw_uid;
  const gid_t gid = nobody->pw_gid;
  ASSERT_EQ(::mkdir(dir_.Path("disk").c_str(), 0755), 0);
  ASSERT_EQ(::symlink("disk", dir_.Path("vol").c_str()), 0);
  // Name, mode, ACL; "hidden" lies in a folder only root may enter, "swapped" in one anyone may
  // write.
  const std::vector<std::tuple<std::string, mode_t, std::string>> files = {
      {"pub/memo granted.txt", 0600, "u:nobody:r--"},
      {"pub/memo denied.txt", 0644, "u:nobody:---"},
      {"priv/memo hidden.txt", 0644, ""},
      {"team/memo swapped.txt", 0600, ""}};
  std::vector<Json::Value> upserts;
  for (const auto& [rel, mode, acl] : files) {
    const std::string path = dir_.Write("disk/share/" + rel, "x");
    ASSERT_EQ(::chmod(path.c_str(), mode), 0);
    if (!acl.empty()) {
      ASSERT_EQ(std::system(("setfacl -m " + acl + " '" + path + "'").c_str()), 0) << acl;
    }
    const std::string word = rel.substr(rel.find(' ') + 1, rel.find('.') - rel.find(' ') - 1);
    Json::Value upsert = tc::Upsert(dir_.Path("vol/share/" + rel));
    upsert["data"]["data"]["QUIXMDTextContent"] = "memo about " + word + "stuff";
    upserts.push_back(upsert);
  }
  for (const char* rel : {"disk/share", "disk/share/pub"}) ::chmod(dir_.Path(rel).c_str(), 0755);
  ASSERT_EQ(::chmod(dir_.Path("disk/share/priv").c_str(), 0700), 0);
  ASSERT_EQ(::chmod(dir_.Path("disk/share/team").c_str(), 0777), 0);
  dir_.Write("disk/share/team/readable.txt", "x");
  Launch();
  Json::Value create = OnIndex("index_create");
  create["data"]["path"] = dir_.Path("vol/share/@eaDir/@fileindex/db");
  create["data"]["mappings"] = tc::FileMappings();
  ASSERT_EQ(Send(create)["success"], true);
  ASSERT_EQ(Send(tc::Compound(upserts))["has_fail"], false);
  EXPECT_TRUE(tc::RequestAs(daemon_->socket(), Cmd("index_list", Json::Value()), uid, gid).isNull());
  const Json::Value upsert = tc::RequestAs(daemon_->public_socket(), upserts[0], uid, gid);
  EXPECT_EQ(upsert["error"]["code"], kCodePermissionDenied) << JsonToString(upsert);
  // Nobody renames a link to a file it may read over the indexed secret: the kernel would now
  // open the link's target, yet the index still holds the secret's words under its name.
  ASSERT_EQ(orvane::test::RunAsUser("nobody", [&] {
              const std::string team = dir_.Path("disk/share/team/");
              return ::symlink("readable.txt", (team + ".t").c_str()) == 0 &&
                     ::rename((team + ".t").c_str(), (team + "memo swapped.txt").c_str()) == 0;
            }),
            1);

  auto ask = [&](const std::string& command, const std::string& data, bool as_root) {
    const Json::Value req = tc::Parse(R"({"command": ")" + command + R"(", "data": )" + data + "}");
    const Json::Value reply =
        as_root ? Send(req) : tc::RequestAs(daemon_->public_socket(), req, uid, gid);
    EXPECT_EQ(reply["success"], true) << JsonToString(reply);
    return reply["data"];
  };
  const Json::Value by_name = ask("search", R"({"name": "memo"})", false);
  ASSERT_EQ(by_name["total"], 1) << JsonToString(by_name);
  EXPECT_EQ(by_name["hits"][0]["path"], dir_.Path("vol/share/pub/memo granted.txt"));
  EXPECT_EQ(ask("search", R"({"name": "memo"})", true)["total"], 4);
  for (const char* word : {"deniedstuff", "hiddenstuff", "swappedstuff"}) {
    const std::string query = std::string(R"({"keyword": ")") + word + "\"}";
    EXPECT_EQ(ask("search", query, false)["total"], 0) << word;
    EXPECT_EQ(ask("search", query, true)["total"], 1) << word;
  }
  // Suggestions offer no word found only in files nobody may not open.
  std::vector<std::string> offered;
  for (const char* prefix : {"gran", "deni", "hidd", "swap"}) {
    const std::string data = std::string(R"({"prefix": ")") + prefix + R"(", "size": 100})";
    const Json::Value mine = ask("suggest", data, false);
    for (const Json::Value& w : mine["suggestions"]) offered.push_back(w.asString());
    EXPECT_FALSE(ask("suggest", data, true)["suggestions"].empty()) << prefix;
  }
  EXPECT_THAT(offered, ::testing::UnorderedElementsAre("granted", "grantedstuff"));
}

}  // namespace
}  // namespace elasticd
}  // namespace orvane
