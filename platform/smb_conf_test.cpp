#include "platform/smb_conf.hpp"

#include <gtest/gtest.h>
#include <unistd.h>

#include <sstream>

#include "common/error.hpp"
#include "platform/share.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace platform {
namespace {

std::vector<std::string> Names(const PlatformConfig& config) {
  std::vector<std::string> names;
  for (const ShareConfig& share : config.shares) names.push_back(share.name + "=" + share.path);
  return names;
}

std::string Lower(std::string s) {
  for (char& c : s) c = static_cast<char>(tolower(static_cast<unsigned char>(c)));
  return s;
}

bool AnyContains(const std::vector<std::string>& lines, const std::string& text) {
  for (const std::string& line : lines) {
    if (line.find(text) != std::string::npos) return true;
  }
  return false;
}

// A server without platform.json: the shares are Samba's, read through the keys file.
class SambaSharesTest : public ::testing::Test {
 protected:
  SambaSharesTest() : scoped_(root_.path()) {}

  void UseSmbConf(const std::string& path, const std::string& more_keys = "") {
    test::WriteFile(root_.Path("etc/orvane/fileindex.conf"),
                    "# keys of this server\nsamba_conf = " + path + "\n" + more_keys);
  }

  std::string LoadFault() {
    const Error e = test::ErrorOf([] { LoadPlatformConfig(); });
    EXPECT_EQ(e.code, kErrLoadConfig);
    return e.message;
  }

  test::TempDir root_;
  test::TempDir etc_;
  test::ScopedRoot scoped_;
};

// Debian's own default file exports no folder the index could take: [homes] has no path and
// [print$] is not named after its folder; both are told, the printers are left out silently.
TEST_F(SambaSharesTest, DebiansDefaultFileReadsWithNotesForWhatCannotBeIndexed) {
  const std::string debian = "/usr/share/samba/smb.conf";
  ASSERT_EQ(access(debian.c_str(), R_OK), 0) << "scripts/setup.sh installs samba";
  UseSmbConf(debian);
  auto config = LoadPlatformConfig();
  EXPECT_TRUE(config->shares.empty());
  EXPECT_EQ(config->source, debian);
  EXPECT_TRUE(AnyContains(config->skipped, "share [homes] has no path"));
  EXPECT_TRUE(AnyContains(config->skipped, "share [print$]: its folder /var/lib/samba/printers"));
  EXPECT_FALSE(AnyContains(config->skipped, "[printers]"));
}

TEST_F(SambaSharesTest, IncludesHomesAndSambasSpellingsBecomeShares) {
  const std::string main = etc_.Write("smb.conf", R"(
# a comment
; another comment
[global]
   VFS Objects = recycle
   include = shares.d/music.conf
   include = /no/such/file.conf
   include = /etc/samba/%m.conf

[homes]
   path = /srv/v1/homes/%S
   vfs objects = \
      fruit streams_xattr
   invalid users = eve @interns "+Domain Guests"

[  My   Docs ]
   Path = /srv/v1/my docs/
   hide_unreadable = yes
   hideunreadable = Yes

[Photo]  trailing text is ignored
   path = /srv//v1/photo
[off]
   path = /srv/v1/off
   available = no
[per-user]
   path = /srv/%U
[elsewhere]
   path = /srv/v1/other
[lp]
   path = /var/spool/lp
   printable = yes
[nopath]
   comment = forgot it
)");
  etc_.Write("shares.d/music.conf",
             "[music]\n  directory = /srv/v1/music\n  read only = yes\n[my docs]\n"
             "  hide unreadable = no\n");
  UseSmbConf(main, "admin_group = fileindex admins\n");
  test::LogCapture log;
  auto config = LoadPlatformConfig();

  EXPECT_EQ(Names(*config),
            (std::vector<std::string>{"music=/srv/v1/music", "my docs=/srv/v1/my docs",
                                      "homes=/srv/v1/homes", "photo=/srv/v1/photo"}));
  EXPECT_EQ(config->admin_group, "fileindex admins");
  const ShareConfig* homes = config->FindShare("homes");
  EXPECT_FALSE(homes->recycle_bin);  // its own vfs objects replace the [global] ones
  EXPECT_EQ(homes->user_access, (std::map<std::string, int>{{"eve", SHARE_NOACCESS}}));
  EXPECT_EQ(homes->group_access, (std::map<std::string, int>{{"interns", SHARE_NOACCESS},
                                                             {"Domain Guests", SHARE_NOACCESS}}));
  // The include, read first, made [my docs]; the later header added to it and set the flag.
  EXPECT_TRUE(config->FindShare("my docs")->hide_unreadable);
  EXPECT_TRUE(config->FindShare("photo")->recycle_bin);
  EXPECT_FALSE(config->FindShare("music")->readonly);  // clients' read only: still indexed

  for (const char* why : {"/no/such/file.conf cannot be read", "%m.conf depends on who connects",
                          "[off] is switched off", "[per-user]: path /srv/%U depends on who",
                          "[elsewhere]: its folder /srv/v1/other does not bear",
                          "[nopath] has no path"}) {
    EXPECT_TRUE(AnyContains(config->skipped, why)) << why;
    EXPECT_TRUE(log.Contains(why)) << why;
  }
  EXPECT_FALSE(AnyContains(config->skipped, "[lp]"));
  EXPECT_TRUE(AnyContains(config->skipped, main + ":8:"));  // notes name file and line

  // The platform calls see the shares; a change in an included file is read again.
  PQUIXSHARE share = nullptr;
  ASSERT_EQ(QUIXShareGet("music", &share), 0);
  EXPECT_STREQ(share->szPath, "/srv/v1/music");
  QUIXShareFree(share);
  etc_.Write("shares.d/music.conf", "[jazz]\n  path = /srv/v2/jazz\n");
  EXPECT_EQ(QUIXShareGet("music", &share), -1);
  ASSERT_EQ(QUIXShareGet("jazz", &share), 0);
  QUIXShareFree(share);

  // platform.json, once written, wins over Samba's file.
  test::WritePlatformConfig(root_.path(), R"({"shares": [{"name": "a", "path": "/v/a"}]})");
  EXPECT_EQ(Names(*LoadPlatformConfig()), std::vector<std::string>{"a=/v/a"});
}

// Samba's own reader, through testparm, sees the same sections with the same paths.
TEST_F(SambaSharesTest, SectionsAndPathsAgreeWithTestparm) {
  const std::string inc = etc_.Write("inc.conf", "[Music]\n  read only = no\n[jazz]\n  path = /j/jazz\n");
  const std::string main = etc_.Write("smb.conf", "; comment\n[global]\n  include = " + inc +
                                                      "\n[music]\n  PATH = /srv/a b/music\n"
                                                      "[Long Name]\n  path = /srv/\\\n   long  name\n"
                                                      "#[commented]\n[jazz]\n  path = /k/jazz\n");
  const test::ProgramResult tp = test::RunProgram("/usr/bin/testparm", {"-s", main});
  ASSERT_EQ(tp.status, 0) << tp.err;
  std::map<std::string, std::string> theirs;
  std::string section;
  std::istringstream lines(tp.out);
  for (std::string line; std::getline(lines, line);) {
    if (line.size() > 2 && line[0] == '[') section = Lower(line.substr(1, line.size() - 2));
    if (section != "global" && line.rfind("\tpath = ", 0) == 0) theirs[section] = line.substr(8);
  }
  std::map<std::string, std::string> ours;
  for (const SmbSection& s : ReadSmbConf(main).sections) ours[Lower(s.name)] = s.Find("path")->text;
  EXPECT_EQ(ours, theirs);
  EXPECT_EQ(ours.size(), 3u);
}

TEST_F(SambaSharesTest, BrokenFilesAreErrorsNamingFileAndLine) {
  const std::string smb = etc_.Path("smb.conf");
  const struct {
    const char* text;
    const char* fault;
  } cases[] = {
      {"[global]\n[music\npath = /a/music\n", ":2: the section header [music has no closing"},
      {"[ok]\n  path = /a/ok\n[ ]\n", ":3: the section header [] has no name"},
      {"[music]\n  path /a/music\n", ":2: \"path /a/music\" is neither a [section] header"},
      {"[music]\n  = /a/music\n", ":2: a value without a parameter name"},
      {"[music]\n  path = /a/music\n  available = \\\n  maybe\n",
       ":3: \"available = maybe\" is not yes or no"},
      {"[music]\n  path = /a/music\n  include = smb.conf\n", ":3: includes "},
  };
  UseSmbConf(smb);
  for (const auto& c : cases) {
    test::WriteFile(smb, c.text);
    const std::string message = LoadFault();
    EXPECT_NE(message.find(smb + c.fault), std::string::npos) << c.text << " -> " << message;
  }

  // The keys file is checked as strictly.
  UseSmbConf(smb, "admin group = staff\n");
  EXPECT_NE(LoadFault().find(root_.Path("etc/orvane/fileindex.conf") +
                             ":3: unknown key \"admingroup\"; the keys are admin_group and"),
            std::string::npos);
  UseSmbConf("relative/smb.conf");
  EXPECT_NE(LoadFault().find(":2: \"samba_conf\" needs an absolute path"), std::string::npos);

  // Neither platform.json nor Samba: the default path lies under the root and is named.
  ASSERT_EQ(unlink(root_.Path("etc/orvane/fileindex.conf").c_str()), 0);
  EXPECT_NE(LoadFault().find(root_.Path("etc/samba/smb.conf") +
                             ": cannot be read: No such file or directory; without it or "),
            std::string::npos);
}

}  // namespace
}  // namespace platform
}  // namespace orvane
