#include "common/sdk/share.hpp"

#include <gtest/gtest.h>

#include <functional>

#include "common/error.hpp"
#include "platform/config.hpp"
#include "platform/platform_error.hpp"
#include "test/faults.hpp"
#include "test/share_fixture.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace sdk {
namespace {

using platform::Fault;
using platform::ScopedFaults;

class SDKShareTest : public test::ShareFixture {
 protected:
  void SetUp() override {
    WriteShares(R"(
      {"name": "music", "path": ")" + vol_ + R"(/music", "recycle_bin": true, "ftp_privilege": 5},
      {"name": "vault", "path": ")" + vol_ + R"(/vault", "encrypted": true, "encryption": true},
      {"name": "ro", "path": ")" + vol_ + R"(/ro", "readonly": true, "hide_unreadable": true},
      {"name": "open", "path": ")" + vol_ + R"(/open", "encryption": true},
      {"name": "my music é", "path": ")" + vol_ +
                                                R"(/my music é"})");
  }

  // Runs `fn`, expects an Error with `code` whose reason is `reason`.
  template <typename Fn>
  void ExpectError(Fn fn, ErrorCode code, const std::string& reason) {
    try {
      fn();
      ADD_FAILURE() << "no Error for " << reason;
    } catch (const Error& e) {
      EXPECT_EQ(e.code, code);
      EXPECT_EQ(e.message, "Orvane error, code=" + std::to_string(code) +
                               (reason.empty() ? "" : ", reason=[" + reason + "]"));
    }
  }
};

// Which shares can be indexed is judged, share flags and all, by the index rules' tests.
TEST_F(SDKShareTest, LocationsAndFlagsOfAShare) {
  SDKShare music("music");
  EXPECT_EQ(music.GetPath(), vol_ + "/music");
  EXPECT_EQ(music.GetFTPPrivilege(), 5);
  EXPECT_TRUE(music.IsEnableRecycleBin());
  EXPECT_TRUE(SDKShare("ro").IsHideUnReadable());

  SDKShare spaced("my music é");
  EXPECT_EQ(spaced.GetQueuePath(), vol_ + "/my music é/@eaDir/@fileindex/queue");
  EXPECT_EQ(spaced.GetDBPath(), vol_ + "/my music é/@eaDir/@fileindex/db");
  EXPECT_EQ(spaced.GetDBName(), "fileindex_my music é");
  EXPECT_EQ(SDKShare::Enum(),
            (std::set<std::string>{"music", "my music é", "open", "ro", "vault"}));
}

TEST_F(SDKShareTest, UnknownShareOrUnusableConfigurationIsError800) {
  test::LogCapture log;
  ExpectError([] { SDKShare share("Music"); }, kErrShareGet, "Music");
  ExpectError([] { SDKShare share("music/x"); }, kErrShareGet, "music/x");
  ExpectError([] { SDKShare share(""); }, kErrShareGet, "");
  EXPECT_TRUE(log.Contains(
      "Failed [0 > QUIXShareGet(share_name.c_str(), &share_info_) || !share_info_], reason: "
      "Orvane error, code=800, reason=[Music]"));
  test::WritePlatformConfig(root_.path(), "{\"shares\": [{\"name\": \"music\"}]}");
  ExpectError([] { SDKShare share("music"); }, kErrShareGet, "music");
  ExpectError([] { SDKShare::Enum(); }, kErrShareEnum, "QLIBShareEnum failed");
}

TEST_F(SDKShareTest, PlatformFailuresBecomeErrors) {
  ScopedFaults faults;
  test::LogCapture log;
  SDKShare music("music");
  // Every platform call the object makes is checked; the texts come from one routine.
  const std::pair<const char*, std::function<void()>> calls[] = {
      {"QLIBShareIsEncryptedGet", [&] { music.CanBeIndexed(); }},
      {"QLIBShareIsReadOnlyGet", [&] { music.CanBeIndexed(); }},
      {"QLIBShareRecycleStatusGet", [&] { music.IsEnableRecycleBin(); }},
      {"FILEIDXGetIndexID", [&] { music.GetDBName(); }},
      {"QLIBCSzListAlloc", [] { SDKShare::Enum(); }},
      {"QLIBShareEnum", [] { SDKShare::Enum(); }},
  };
  for (const auto& [call, fn] : calls) {
    faults.Arm(call, Fault{-1, EIO});
    EXPECT_THROW(fn(), Error) << call;
  }
  faults.Arm("FILEIDXQueuePathCompose", Fault{-1, EIO});
  ExpectError([&] { music.GetQueuePath(); }, kErrSystem,
              "FILEIDXQueuePathCompose failed, share=music");
  EXPECT_TRUE(log.Contains(
      "Failed [0 > FILEIDXQueuePathCompose(share_info_->szPath, path, sizeof(path))], reason: "
      "Orvane error, code=502, reason=[FILEIDXQueuePathCompose failed, share=music] "
      "[err: Input/output error]"));
  faults.Arm("QLIBShareHideUnreadableGet", Fault{-1, EIO, 0, 1, true});
  EXPECT_FALSE(music.IsHideUnReadable());
  // Once known, a location is not asked again.
  EXPECT_EQ(music.GetDBName(), "fileindex_music");
  faults.Arm("FILEIDXGetIndexID", Fault{-1, EIO});
  EXPECT_EQ(music.GetDBName(), "fileindex_music");
  faults.Arm("QUIXShareGet", Fault{0, 0});  // success without a record
  ExpectError([] { SDKShare share("music"); }, kErrShareGet, "music");
}

TEST_F(SDKShareTest, OnlyAFullVolumeOrQuotaBlocksIndexing) {
  ScopedFaults faults;
  SDKShare music("music");
  // The share's folder does not exist: the platform cannot tell, which never blocks.
  EXPECT_TRUE(music.IsSpaceEnough());
  const std::pair<Fault, bool> cases[] = {{Fault{0, ENOSPC, platform::kQErrVolumeFull}, false},
                                          {Fault{0, EDQUOT, platform::kQErrQuotaExceeded}, false},
                                          {Fault{0, EIO, platform::kQErrSystem}, true},
                                          {Fault{-1, EIO, platform::kQErrVolumeFull}, true}};
  for (const auto& [fault, enough] : cases) {
    faults.Arm("QUIXQuotaIsEnough", fault);
    EXPECT_EQ(music.IsSpaceEnough(), enough) << fault.err;
  }
}

}  // namespace
}  // namespace sdk
}  // namespace orvane
