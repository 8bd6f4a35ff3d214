// The file server's own Spotlight client against the gateway: our three daemons index a real
// share, the gateway answers for it, and a real smbd (run in the foreground in a network
// namespace of this test's own, with a scratch configuration, so it never meets the machine's
// own file server) serves the share to the real mdsearch client as a throwaway local user.
#include <arpa/inet.h>
#include <dirent.h>
#include <fcntl.h>
#include <net/if.h>
#include <netinet/in.h>
#include <sched.h>
#include <signal.h>
#include <sys/ioctl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/time.h>
#include <unistd.h>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <functional>
#include <set>
#include <sstream>
#include <string>
#include <vector>

#include "common/fd.hpp"
#include "fileindex/index_mgr.hpp"
#include "fileindex/util.hpp"
#include "test/daemon_system.hpp"
#include "test/sample_files.hpp"

namespace orvane {
namespace searchgw {
namespace {

using fileindexd::test::ChildProcess;
using fileindexd::test::System;
using fileindexd::test::WaitFor;
using fileindexd::test::WriteFile;

constexpr int kGatewayPort = 19210;
const char kPassword[] = "Sg4te-pass";

int Shell(const std::string& cmd) { return std::system(cmd.c_str()); }

bool CanConnect(int port) {
  UniqueFd fd(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
  sockaddr_in sa{};
  sa.sin_family = AF_INET;
  sa.sin_port = htons(static_cast<uint16_t>(port));
  sa.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  return ::connect(fd.get(), reinterpret_cast<sockaddr*>(&sa), sizeof sa) == 0;
}

// A network of this process's own with its loopback up: smbd may take port 445 there whatever
// the machine runs.
bool OwnLoopback() {
  if (::unshare(CLONE_NEWNET) != 0) return false;
  UniqueFd s(::socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0));
  ifreq ifr{};
  std::strcpy(ifr.ifr_name, "lo");
  if (::ioctl(s.get(), SIOCGIFFLAGS, &ifr) != 0) return false;
  ifr.ifr_flags |= IFF_UP | IFF_RUNNING;
  return ::ioctl(s.get(), SIOCSIFFLAGS, &ifr) == 0;
}

// The pids of the processes whose command line names `needle` (the scratch configuration, so
// only the file server processes this test started).
std::vector<pid_t> ProcessesNaming(const std::string& needle) {
  std::vector<pid_t> pids;
  for (const auto& entry : std::filesystem::directory_iterator("/proc")) {
    const std::string name = entry.path().filename();
    if (name.find_first_not_of("0123456789") != std::string::npos) continue;
    // Read with plain calls: a process that ends meanwhile makes the read fail (ESRCH), which
    // a stream would throw out of the iterator.
    std::string cmdline;
    UniqueFd fd(::open((entry.path() / "cmdline").c_str(), O_RDONLY | O_CLOEXEC));
    char buf[4096];
    ssize_t n = 0;
    while (fd.valid() && (n = ::read(fd.get(), buf, sizeof buf)) > 0) cmdline.append(buf, n);
    if (cmdline.find(needle) != std::string::npos) pids.push_back(std::stoi(name));
  }
  return pids;
}

// A local user for the file server's sign-in, always removed.
struct ScopedSmbUser {
  explicit ScopedSmbUser(const std::string& n) : name(n) {
    ok = Shell("useradd -M -N -s /usr/sbin/nologin " + name) == 0;
  }
  ~ScopedSmbUser() {
    if (ok) Shell("userdel " + name + " 2>/dev/null");
  }
  std::string name;
  bool ok = false;
};

// smbd in the foreground with everything it writes below `dir`; at the end every process that
// names its configuration (smbd's children and the RPC helpers it starts, which leave its
// process tree) is stopped by pid.
class ScratchSmbd {
 public:
  ScratchSmbd(const std::string& root, const std::string& dir, const std::string& share_path,
              const std::string& mappings)
      : conf_(dir + "/smb.conf") {
    for (const char* sub : {"private", "lock", "state", "cache", "pid", "ncalrpc", "log"}) {
      std::filesystem::create_directories(dir + "/" + sub);
    }
    WriteFile(conf_,
              "[global]\n"
              "\tinterfaces = lo\n"
              "\tbind interfaces only = yes\n"
              "\tdisable netbios = yes\n"
              "\tserver role = standalone server\n"
              "\tpassdb backend = tdbsam:" +
                  dir +
                  "/private/passdb.tdb\n"
                  "\tprivate dir = " +
                  dir +
                  "/private\n"
                  "\tlock directory = " +
                  dir +
                  "/lock\n"
                  "\tstate directory = " +
                  dir +
                  "/state\n"
                  "\tcache directory = " +
                  dir +
                  "/cache\n"
                  "\tpid directory = " +
                  dir +
                  "/pid\n"
                  "\tncalrpc dir = " +
                  dir +
                  "/ncalrpc\n"
                  "\tlog file = " +
                  dir +
                  "/log/log.%m\n"
                  "\tload printers = no\n"
                  "\tprintcap name = /dev/null\n"
                  "\tdisable spoolss = yes\n"
                  "\telasticsearch:mappings = " +
                  mappings +
                  "\n"
                  "[share]\n"
                  "\tpath = " +
                  share_path +
                  "\n"
                  "\tread only = yes\n"
                  "\tspotlight = yes\n"
                  "\tspotlight backend = elasticsearch\n"
                  "\telasticsearch:address = 127.0.0.1\n"
                  "\telasticsearch:port = " +
                  std::to_string(kGatewayPort) +
                  "\n"
                  "\telasticsearch:index = fileindex_share\n");
    root_ = root;
  }
  ~ScratchSmbd() {
    for (int round = 0; round < 50; ++round) {
      const std::vector<pid_t> pids = ProcessesNaming(conf_);
      if (pids.empty()) break;
      for (pid_t pid : pids) ::kill(pid, round < 25 ? SIGTERM : SIGKILL);
      ::usleep(100000);
    }
  }

  bool AddUser(const std::string& user) {
    return Shell("printf '%s\\n%s\\n' '" + std::string(kPassword) + "' '" + kPassword +
                 "' | smbpasswd -c " + conf_ + " -a -s " + user + " >/dev/null") == 0;
  }
  void Start() {
    smbd_ = std::make_unique<ChildProcess>(
        root_, std::vector<std::string>{"/usr/sbin/smbd", "--foreground", "--configfile=" + conf_});
  }
  const std::string& conf() const { return conf_; }

 private:
  std::string conf_;
  std::string root_;
  std::unique_ptr<ChildProcess> smbd_;
};

class SambaSpotlightTest : public ::testing::Test {
 protected:
  SambaSpotlightTest() : sys_({"share"}), user_("sgate" + std::to_string(::getpid())) {}

  std::string S(const std::string& rel) const { return sys_.Vol("share/" + rel); }

  // The share-relative paths mdsearch prints for `query`, optionally within `scope`.
  std::set<std::string> Mdsearch(const std::string& query, const std::string& scope = "") {
    std::vector<std::string> args = {"60",          "mdsearch", "-s",
                                     smbd_->conf(), "-U",       user_.name + "%" + kPassword};
    if (!scope.empty()) {
      args.push_back("-p");
      args.push_back(scope);
    }
    for (const char* a : {"127.0.0.1", "share"}) args.push_back(a);
    args.push_back(query);
    const test::ProgramResult r = test::RunProgram("/usr/bin/timeout", args);
    EXPECT_EQ(r.status, 0) << query << ": " << r.err;
    std::set<std::string> lines;
    std::istringstream in(r.out);
    for (std::string line; std::getline(in, line);) {
      if (!line.empty()) lines.insert(line);
    }
    return lines;
  }

  // The files and folders below the share, by what the disk says of them (the share-relative
  // path and its status), that `pred` keeps.
  std::set<std::string> OnDisk(
      const std::function<bool(const std::string&, const struct stat&)>& pred) {
    std::set<std::string> out;
    const std::string root = sys_.Vol("share");
    namespace fs = std::filesystem;
    for (fs::recursive_directory_iterator it(root), end; it != end; ++it) {
      const std::string path = it->path();
      if (path.find("@eaDir") != std::string::npos) {
        it.disable_recursion_pending();
        continue;
      }
      struct stat st;
      if (::lstat(path.c_str(), &st) == 0 && pred(path.substr(root.size() + 1), st)) {
        out.insert(path.substr(root.size() + 1));
      }
    }
    return out;
  }

  System sys_;
  ScopedSmbUser user_;
  std::unique_ptr<ScratchSmbd> smbd_;
};

TEST_F(SambaSpotlightTest, MdsearchListsExactlyTheMatchingFilesOfARealShare) {
  if (::geteuid() != 0) GTEST_SKIP() << "needs root: a user, a network namespace and smbd";
  for (const char* tool : {"/usr/sbin/smbd", "/usr/bin/mdsearch", "/usr/bin/smbpasswd"}) {
    ASSERT_EQ(::access(tool, X_OK), 0) << tool << " is missing: run bash scripts/setup.sh";
  }
  ASSERT_TRUE(OwnLoopback()) << "cannot make a network namespace: " << std::strerror(errno);
  ASSERT_TRUE(user_.ok) << "useradd failed";
  // The signed-in user must reach the share's files.
  ::chmod(sys_.Vol("").c_str(), 0755);

  WriteFile(S("report_foo.txt"), "quarterly zebra figures");
  WriteFile(S("docs/notes.txt"), "a zebra crossing");
  WriteFile(S("docs/foo_big.bin"), std::string(200000, 'x'));
  WriteFile(S("docs/deep/other_foo.md"), "nothing to see");
  WriteFile(S("docs/deep/plain.txt"), "plain words");
  WriteFile(S("old.txt"), "from long ago");
  WriteFile(S("docs/pic.png"), test::SamplePng(40, 30));
  // A name whose bytes are not UTF-8 beside one that is.
  WriteFile(S("caf\xe9_qqq.txt"), "latin");
  WriteFile(S("plain_qqq.txt"), "utf");
  WriteFile(S("docs/Café_menu.txt"), "menu");
  const struct timeval old_times[2] = {{978307200, 0}, {978307200, 0}};  // 2001-01-01
  ASSERT_EQ(::utimes(S("old.txt").c_str(), old_times), 0);

  setenv("FILEINDEX_EXTRACT_HELPER", EXTRACT_HELPER_BIN, 1);
  sys_.WriteFolders(Json::Value(Json::arrayValue));
  auto engine = sys_.StartEngine();
  // The gateway asks the engine as the signed-in user, on the public socket every user reaches.
  for (const std::string& d : {sys_.root(), sys_.root() + "/var", sys_.root() + "/var/run"}) {
    ::chmod(d.c_str(), 0711);
  }
  auto notifyd = sys_.StartNotifyd();
  auto indexd = sys_.StartIndexd();
  Json::Value folders(Json::arrayValue);
  folders.append(System::Folder("/share", true));
  fileindex::FolderAdd(folders, false);
  const size_t entries = OnDisk([](const std::string&, const struct stat&) { return true; }).size();
  ASSERT_TRUE(WaitFor([&] { return sys_.Documents("share").size() == entries + 1; }, 60000))
      << "indexing did not finish";

  ChildProcess gateway(sys_.root(),
                       {SEARCHGW_BIN, "--foreground", "--port", std::to_string(kGatewayPort)});
  ASSERT_TRUE(WaitFor([] { return CanConnect(kGatewayPort); }, 20000));
  test::TempDir smb_dir;
  smbd_ = std::make_unique<ScratchSmbd>(sys_.root(), smb_dir.path(), sys_.Vol("share"),
                                        SEARCHGW_MAPPINGS);
  ASSERT_TRUE(smbd_->AddUser(user_.name));
  smbd_->Start();
  ASSERT_TRUE(WaitFor([] { return CanConnect(445); }, 30000)) << "smbd did not listen";

  auto named = [](const std::string& text) {
    return [text](const std::string& rel, const struct stat&) {
      return Basename(rel).find(text) != std::string::npos;
    };
  };
  EXPECT_EQ(Mdsearch("kMDItemDisplayName==\"*foo*\""), OnDisk(named("foo")));
  EXPECT_EQ(Mdsearch("kMDItemTextContent==\"zebra\""),
            (std::set<std::string>{"report_foo.txt", "docs/notes.txt"}));
  EXPECT_EQ(Mdsearch("kMDItemFSSize>\"100000\""),
            OnDisk([](const std::string&, const struct stat& st) {
              return S_ISREG(st.st_mode) && st.st_size > 100000;
            }));
  EXPECT_EQ(
      Mdsearch("kMDItemFSContentChangeDate<$time.iso(2010-01-01T00:00:00Z)"),
      OnDisk([](const std::string&, const struct stat& st) { return st.st_mtime < 1262304000; }));
  // Names in any case, with or without their accents.
  // The client prints the name decomposed (an "e" and a combining accent).
  EXPECT_THAT(Mdsearch("kMDItemDisplayName==\"*CAFE*\""),
              ::testing::AnyOf(::testing::ElementsAre("docs/Café_menu.txt"),
                               ::testing::ElementsAre("docs/Cafe\u0301_menu.txt")));
  // Members of the documents: an image's pixel size, a whole path.
  EXPECT_EQ(Mdsearch("kMDItemPixelWidth==\"40\" && kMDItemPixelHeight<\"100\""),
            (std::set<std::string>{"docs/pic.png"}));
  EXPECT_EQ(Mdsearch("kMDItemPath==\"*/deep/*\""),
            (std::set<std::string>{"docs/deep/other_foo.md", "docs/deep/plain.txt"}));
  // The reply is JSON text, which cannot carry the bytes of a name that is not UTF-8: such a
  // hit goes out in the index's written form, which the file server finds no file for and
  // leaves out, and the search itself succeeds.
  EXPECT_EQ(Mdsearch("kMDItemDisplayName==\"*qqq*\""), (std::set<std::string>{"plain_qqq.txt"}));
  EXPECT_EQ(Mdsearch("kMDItemDisplayName==\"*foo*\"", "docs"),
            OnDisk([](const std::string& rel, const struct stat&) {
              return rel.rfind("docs/", 0) == 0 && Basename(rel).find("foo") != std::string::npos;
            }));

  // A file written now is found within a few seconds (the bound here is generous; the time it
  // takes is the benchmark's business).
  WriteFile(S("docs/late_foo.txt"), "late");
  const auto start = std::chrono::steady_clock::now();
  EXPECT_TRUE(
      WaitFor([&] { return Mdsearch("kMDItemDisplayName==\"*late*\"").size() == 1; }, 20000));
  std::cerr << "a new file was found after "
            << std::chrono::duration_cast<std::chrono::milliseconds>(
                   std::chrono::steady_clock::now() - start)
                   .count()
            << " ms\n";
}

}  // namespace
}  // namespace searchgw
}  // namespace orvane
