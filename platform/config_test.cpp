#include "platform/config.hpp"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include "common/error.hpp"
#include "platform/platform_error.hpp"
#include "platform/share.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace platform {
namespace {

// The message of the Error that loading the configuration throws.
std::string LoadFault() {
  const Error e = test::ErrorOf([] { LoadPlatformConfig(); });
  EXPECT_EQ(e.code, kErrLoadConfig);
  return e.message;
}

// Flags and access maps are read through the share records built on the configuration; a
// rewritten file is read again by every test that rewrites one.
TEST(PlatformConfigTest, ReadsSharesAndDefaultsOnceWhileTheFileIsUnchanged) {
  test::TempDir root;
  test::ScopedRoot scoped(root.path());
  test::WritePlatformConfig(root.path(), R"({"shares": [
      {"name": "music", "path": "/srv/v1/music", "readonly": true, "future_key": [1, 2]},
      {"name": "Fotos 2024 é", "path": "/srv/v1/Fotos 2024 é"}]})");
  auto config = LoadPlatformConfig();
  ASSERT_EQ(config->shares.size(), 2u);
  ASSERT_NE(config->FindShare("music"), nullptr);
  EXPECT_TRUE(config->FindShare("music")->readonly);
  EXPECT_NE(config->FindShare("Fotos 2024 é"), nullptr);
  EXPECT_EQ(config->admin_group, "administrators");
  EXPECT_EQ(config->samba_conf, root.path() + "/etc/samba/smb.conf");
  EXPECT_EQ(LoadPlatformConfig(), config);
}

TEST(PlatformConfigTest, EveryFaultIsAnErrorNamingTheFile) {
  test::TempDir root;
  test::ScopedRoot scoped(root.path());
  const std::string file = root.path() + "/etc/orvane/platform.json";

  const struct {
    const char* text;
    const char* fault;
  } cases[] = {
      {R"({"shares": [)", "malformed JSON"},
      {R"({"a": 1, "a": 2})", "malformed JSON"},
      {"[1]", "the top level is not a JSON object"},
      {R"({"shares": [3]})", "share #1 is not an object"},
      {R"({"shares": [{"path": "/a/b"}]})", "share #1 has no \"name\""},
      {R"({"shares": [{"name": "a/b", "path": "/v/a/b"}]})", "invalid share name \"a/b\""},
      {R"({"shares": [{"name": "..", "path": "/v/.."}]})", "invalid share name \"..\""},
      {R"({"shares": [{"name": "b"}]})", "share \"b\" has no \"path\""},
      {R"({"shares": [{"name": "b", "path": "/a/../b"}]})", "is not a clean absolute path"},
      {R"({"shares": [{"name": "b", "path": "/a/c"}]})",
       "the last component of \"path\" \"/a/c\" is not the share name"},
      {R"({"shares": [{"name": "b", "path": "/a/b"}, {"name": "b", "path": "/c/b"}]})",
       "two shares are named \"b\""},
      {R"({"shares": [{"name": "b", "path": "/a/b", "readonly": "yes"}]})",
       "share \"b\": \"readonly\" is not true or false"},
      {R"({"shares": [{"name": "b", "path": "/a/b", "access": {"users": {"x": "w"}}}]})",
       "access must be \"rw\", \"ro\" or \"na\""},
      {R"({"admin_group": 7})", "\"admin_group\" is not a non-empty string"},
      {R"({"services": {"samba": {"start": "/bin/true"}}})",
       "service \"samba\": \"start\" is not a non-empty array of strings"},
  };
  for (const auto& c : cases) {
    test::WritePlatformConfig(root.path(), c.text);
    const std::string message = LoadFault();
    EXPECT_NE(message.find(file + ": "), std::string::npos) << c.text << " -> " << message;
    EXPECT_NE(message.find(c.fault), std::string::npos) << c.text << " -> " << message;
  }

  // A folder where the file should be.
  ASSERT_EQ(unlink(file.c_str()), 0);
  ASSERT_EQ(mkdir(file.c_str(), 0755), 0);
  EXPECT_NE(LoadFault().find(file + ": cannot be read: not a regular file"), std::string::npos);
}

// A snapshot scope pins one configuration for the calls made inside it; an unusable file pins
// nothing, and the calls report it themselves.
TEST(PlatformConfigTest, SnapshotsAndPlatformCallsOnAnUnusableFile) {
  test::TempDir root;
  test::ScopedRoot scoped(root.path());
  test::WritePlatformConfig(root.path(), R"({"shares": [{"name": "a", "path": "/v/a"}]})");
  PQUIXSHARE share = nullptr;
  {
    ScopedConfigSnapshot snapshot;
    test::WritePlatformConfig(root.path(), R"({"shares": [{"name": "b", "path": "/v/b"}]})");
    {
      ScopedConfigSnapshot nested;
      EXPECT_EQ(QUIXShareGet("a", &share), 0);
      QUIXShareFree(share);
    }
    EXPECT_EQ(QUIXShareGet("b", &share), -1);
  }
  EXPECT_EQ(QUIXShareGet("b", &share), 0);
  QUIXShareFree(share);

  test::LogCapture log;
  test::WritePlatformConfig(root.path(), "{\"shares\": [{\"name\": \"x\"}]}");
  ScopedConfigSnapshot snapshot;
  share = nullptr;
  EXPECT_EQ(QUIXShareGet("x", &share), -1);
  EXPECT_EQ(QLIBCErrGet(), kQErrConfig);
  EXPECT_TRUE(log.Contains("platform.json: share \"x\" has no \"path\""));
}

}  // namespace
}  // namespace platform
}  // namespace orvane
