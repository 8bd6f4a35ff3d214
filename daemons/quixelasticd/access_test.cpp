// The search-time permission check against real files, real ACLs, real symlinks and real
// users (nobody, and a user and group this test creates and removes), compared with what the
// kernel itself lets that user open.
#include "daemons/quixelasticd/access.hpp"

#include <fcntl.h>
#include <grp.h>
#include <pwd.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <functional>
#include <tuple>

#include <gtest/gtest.h>

#include "test/faults.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace elasticd {
namespace {

int Shell(const std::string& command) {
  const int rc = std::system(command.c_str());
  return WIFEXITED(rc) ? WEXITSTATUS(rc) : -1;
}

// A group and a user who belongs to it besides its own primary group "nogroup", created with
// groupadd/useradd for the test and always removed.
struct ScopedUser {
  ScopedUser() {
    const struct passwd* pw = nullptr;
    const struct group* gr = nullptr;
    ok =
        Shell("groupadd " + group_name) == 0 &&
        Shell("useradd -M -N -g nogroup -G " + group_name + " -s /usr/sbin/nologin " + name) == 0 &&
        (pw = ::getpwnam(name.c_str())) != nullptr &&
        (gr = ::getgrnam(group_name.c_str())) != nullptr;
    if (ok) std::tie(uid, gid, group) = std::tie(pw->pw_uid, pw->pw_gid, gr->gr_gid);
  }
  ~ScopedUser() {
    Shell("userdel " + name + " 2>/dev/null");
    Shell("groupdel " + group_name + " 2>/dev/null");
  }
  ScopedUser(const ScopedUser&) = delete;
  ScopedUser& operator=(const ScopedUser&) = delete;

  const std::string name = "fiacc" + std::to_string(::getpid());
  const std::string group_name = name + "g";
  bool ok = false;
  uid_t uid = 0;
  gid_t gid = 0;
  gid_t group = 0;
};

// Runs `fn` in a child with the full identity of `user` (its groups from the user database,
// as a login gives them); its return value, or -1.
int AsUser(const std::string& user, const std::function<int()>& fn) {
  const struct passwd* pw = ::getpwnam(user.c_str());
  if (pw == nullptr) return -1;
  const pid_t pid = ::fork();
  if (pid == 0) {
    const bool switched = ::initgroups(user.c_str(), pw->pw_gid) == 0 &&
                          ::setgid(pw->pw_gid) == 0 && ::setuid(pw->pw_uid) == 0;
    _exit(switched ? fn() & 0xff : 255);
  }
  int status = 0;
  if (pid < 0 || ::waitpid(pid, &status, 0) != pid || !WIFEXITED(status) ||
      WEXITSTATUS(status) == 255) {
    return -1;
  }
  return WEXITSTATUS(status);
}

// What the kernel lets `user` do: list the file's folder and open the file for reading.
bool KernelLets(const std::string& user, const std::string& path) {
  return AsUser(user, [&] {
           const std::string parent = path.substr(0, path.find_last_of('/'));
           const int dir = ::open(parent.c_str(), O_RDONLY | O_DIRECTORY);
           const int fd = ::open(path.c_str(), O_RDONLY | O_NONBLOCK);
           return dir >= 0 && fd >= 0 ? 1 : 0;
         }) == 1;
}

// Grants to 40 numbered users, then to the test user.
std::string LongAcl() {
  std::string acl;
  for (int uid = 70001; uid <= 70040; ++uid) acl += "u:" + std::to_string(uid) + ":r--,";
  return acl + "u:USER:r--";
}

class AccessTest : public ::testing::Test {
 protected:
  void SetUp() override {
    if (::geteuid() != 0) GTEST_SKIP() << "needs root to create users and switch to them";
    ASSERT_TRUE(user_.ok) << "groupadd/useradd failed";
    ::chmod(dir_.path().c_str(), 0755);
  }
  // A file (or folder, for a name ending in '/') owned by root and `gid`, with `mode`, then
  // `acl` applied with setfacl -m (USER and GROUP in it stand for the test user and group).
  std::string Make(const std::string& rel, mode_t mode, std::string acl = "", gid_t gid = 0) {
    std::string path = dir_.Path(rel);
    if (path.back() == '/') {
      path.pop_back();
      EXPECT_EQ(Shell("mkdir -p '" + path + "'"), 0);
    } else {
      dir_.Write(rel, "x");
    }
    EXPECT_EQ(::chown(path.c_str(), 0, gid), 0);
    EXPECT_EQ(::chmod(path.c_str(), mode), 0);
    for (const auto& [from, to] :
         {std::pair<std::string, std::string>{"USER", user_.name}, {"GROUP", user_.group_name}}) {
      for (size_t at; (at = acl.find(from)) != std::string::npos;) acl.replace(at, from.size(), to);
    }
    if (!acl.empty()) EXPECT_EQ(Shell("setfacl -m " + acl + " '" + path + "'"), 0) << acl;
    return path;
  }
  AccessChecker Checker() { return AccessChecker(user_.uid, user_.gid); }

  ScopedUser user_;
  orvane::test::TempDir dir_;
};

TEST_F(AccessTest, ModesAndAclsDecideAsTheKernelDoes) {
  struct Case {
    std::string rel;
    mode_t mode;
    std::string acl;
    bool visible;
    bool group_owned = false;
  };
  const std::vector<Case> cases = {
      {"plain/open.txt", 0644, "", true},
      {"plain/closed.txt", 0600, "", false},
      {"acl/denied.txt", 0644, "u:USER:---", false},
      {"acl/granted.txt", 0600, "u:USER:r--", true},
      {"acl/group granted.txt", 0600, "g:GROUP:r--", true},
      {"acl/group denied.txt", 0644, "g:GROUP:---", false},
      {"acl/masked.txt", 0600, "u:USER:r--,m::---", false},
      // A named user entry wins over a group that would grant.
      {"acl/user over group.txt", 0600, "u:USER:---,g:GROUP:r--", false},
      // One matching group grants although another matching one does not.
      {"acl/two groups.txt", 0600, "g:nogroup:---,g:GROUP:r--", true},
      // A mask of nothing leaves no group class bits: the kernel then reads the mode alone,
      // and "other" may read.
      {"acl/empty mask.txt", 0604, "u:USER:---,m::---", true},
      // The owning group's entry, not the mask shown in the mode, decides for its members.
      {"acl/owning group.txt", 0600, "g::---,u:nobody:r--", false, true},
      // More entries than the first read of the ACL takes.
      {"acl/long.txt", 0600, LongAcl(), true},
      // 711 lets others reach a file whose name they know, but not list it; below
      // such a folder a listable one shows its names again.
      {"list/x only/file.txt", 0644, "", false},
      {"list/x only/sub/deep.txt", 0644, "", true},
      {"list/acl list/file.txt", 0644, "", true},
      {"list/acl no list/file.txt", 0644, "", false},
      {"enter/acl no search/sub/file.txt", 0644, "", false},
  };
  Make("list/x only/", 0711);
  Make("list/acl list/", 0700, "u:USER:r-x");
  Make("list/acl no list/", 0750, "u:USER:--x,g:GROUP:r-x");
  Make("enter/acl no search/", 0755, "u:USER:r--");
  for (const Case& c : cases) Make(c.rel, c.mode, c.acl, c.group_owned ? user_.group : 0);
  Make("enter/acl no search/sub/", 0755);
  Make("list/x only/sub/", 0755);
  AccessChecker checker = Checker();
  for (const Case& c : cases) {
    const std::string path = dir_.Path(c.rel);
    EXPECT_EQ(KernelLets(user_.name, path), c.visible) << c.rel;
    EXPECT_EQ(checker.CanOpen(path), c.visible) << c.rel;
  }

  // The owner is judged by the owner bits alone, whatever the others may do; the owner of a
  // folder others may not list lists it.
  const std::string own = Make("plain/own.txt", 0044);
  ASSERT_EQ(::chown(own.c_str(), user_.uid, 0), 0);
  ASSERT_EQ(::chown(dir_.Path("list/x only").c_str(), user_.uid, 0), 0);
  EXPECT_FALSE(KernelLets(user_.name, own));
  EXPECT_FALSE(Checker().CanOpen(own));
  EXPECT_TRUE(Checker().CanOpen(dir_.Path("list/x only/file.txt")));
}

TEST_F(AccessTest, SymlinksBelowTheShareAreNeverFollowed) {
  // A folder replaced by a link hides everything below it. (A file replaced by one is checked
  // through the daemon, against the kernel.)
  Make("vol/share/pub/", 0755);
  const std::string pub = Make("vol/share/pub/doc.txt", 0644);
  const std::string share = dir_.Path("vol/share");
  ASSERT_EQ(::symlink("pub", dir_.Path("vol/share/linked").c_str()), 0);
  AccessChecker checker = Checker();
  EXPECT_FALSE(checker.CanOpen(dir_.Path("vol/share/linked/doc.txt"), share));
  EXPECT_TRUE(checker.CanOpen(pub, share));

  // Links at or above the share's root are the administrator's: followed as the kernel
  // follows them, with the target's own folders checked. Without a share root none is.
  ASSERT_EQ(::symlink("vol", dir_.Path("volume").c_str()), 0);
  const std::string via = dir_.Path("volume/share/pub/doc.txt");
  EXPECT_TRUE(checker.CanOpen(via, dir_.Path("volume/share")));
  EXPECT_FALSE(checker.CanOpen(via, share));
  EXPECT_FALSE(Checker().CanOpen(via));
  Make("closed/", 0700);
  Make("closed/vol/share/", 0755);
  const std::string behind = dir_.Path("behind");
  ASSERT_EQ(::symlink("closed/vol", behind.c_str()), 0);
  Make("closed/vol/share/doc.txt", 0644);
  EXPECT_FALSE(Checker().CanOpen(behind + "/share/doc.txt", behind + "/share"));

  // Paths that are not plain never pass: ".." would climb out of a folder the walk checked.
  for (const std::string& odd :
       {dir_.Path("vol/share/pub/../pub/doc.txt"), std::string("vol/share/pub/doc.txt")}) {
    EXPECT_FALSE(Checker().CanOpen(odd, share)) << odd;
  }
}

TEST_F(AccessTest, AFolderSwappedDuringARequestHidesWhatIsBelowIt) {
  // Root's folder in a team folder anyone may write holds a secret and a public file; the user
  // has a folder of their own with a readable file under the secret's name.
  Make("team/", 0777);
  Make("team/root/", 0755);
  const std::string secret = Make("team/root/secret.txt", 0600);
  const std::string shown = Make("team/root/public.txt", 0644);
  Make("team/mine/secret.txt", 0644);
  const std::string note = Make("team/note.txt", 0644);
  AccessChecker checker = Checker();
  ASSERT_TRUE(checker.CanOpen(shown));
  // Between two hits of one request the user puts their folder in the place of root's: the
  // folder answer the checker keeps is for root's folder, not for what the path now leads to.
  const std::string team = dir_.Path("team");
  ASSERT_EQ(AsUser(user_.name,
                   [&] {
                     return ::rename((team + "/root").c_str(), (team + "/old").c_str()) == 0 &&
                            ::rename((team + "/mine").c_str(), (team + "/root").c_str()) == 0;
                   }),
            1);
  EXPECT_FALSE(checker.CanOpen(secret));
  // Also once the checker has looked elsewhere and must find the folder again by its path.
  EXPECT_TRUE(checker.CanOpen(note));
  EXPECT_FALSE(checker.CanOpen(secret));
  EXPECT_TRUE(KernelLets(user_.name, secret));
}

TEST_F(AccessTest, AclsAreReadOnOlderKernelsAndAFailedReadHidesTheFile) {
  const std::string open = Make("plain/open.txt", 0644);
  const std::string denied = Make("acl/denied.txt", 0644, "u:USER:---");
  const std::string granted = Make("acl/granted.txt", 0600, "u:USER:r--");
  // The first answer leaves the folders known, so the faults below meet the file's ACL alone.
  AccessChecker checker = Checker();
  ASSERT_TRUE(checker.CanOpen(open));
  {
    platform::ScopedFaults faults;
    faults.Arm("getxattrat", platform::Fault{-1, EIO}, 0, -1);
    EXPECT_FALSE(checker.CanOpen(open));
    EXPECT_EQ(platform::CallCount("getxattrat"), 1);
  }
  {
    // A kernel without getxattrat(): the ACLs are read another way and decide the same.
    platform::ScopedFaults faults;
    faults.Arm("getxattrat", platform::Fault{-1, ENOSYS}, 0, -1);
    AccessChecker old_kernel = Checker();
    EXPECT_TRUE(old_kernel.CanOpen(open));
    EXPECT_FALSE(old_kernel.CanOpen(denied));
    EXPECT_TRUE(old_kernel.CanOpen(granted));
  }
}

TEST(AccessShareRootTest, IsTheFolderHoldingTheIndexFolder) {
  EXPECT_EQ(AccessChecker::ShareRootOf("/volume1/docs/@eaDir/@fileindex/db//"), "/volume1/docs");
  EXPECT_EQ(AccessChecker::ShareRootOf("/var/lib/index/db"), "");
  EXPECT_EQ(AccessChecker::ShareRootOf("/v/../@eaDir/@fileindex/db"), "");
}

}  // namespace
}  // namespace elasticd
}  // namespace orvane
