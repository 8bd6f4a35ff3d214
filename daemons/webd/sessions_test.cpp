// Sessions and sign-in limits on a fake clock.
#include "daemons/webd/sessions.hpp"

#include <gtest/gtest.h>

#include <set>

#include "test/test_util.hpp"

namespace orvane {
namespace webd {
namespace {

constexpr int64_t kSecond = 1000000;

TEST(SessionMgrTest, SessionsEndWhenIdleWhenTooOldOrWhenTheTableIsFull) {
  test::FakeEnv env;
  SessionMgr mgr(60 * kSecond, 600 * kSecond, 3);
  const WebSession a = mgr.Create("ann", 1001, false);
  EXPECT_EQ(a.token.size(), 64u);
  EXPECT_NE(a.token, a.csrf);
  // Used every 50 s it stays, until its whole life is over.
  for (int i = 0; i < 11; ++i) {
    env.Advance(50 * kSecond);
    ASSERT_TRUE(mgr.Find(a.token)) << i;
  }
  env.Advance(60 * kSecond);
  EXPECT_FALSE(mgr.Find(a.token));
  // Left alone past the idle time, it is gone, and stays gone.
  const WebSession b = mgr.Create("bob", 1002, true);
  env.Advance(61 * kSecond);
  EXPECT_FALSE(mgr.Find(b.token));
  EXPECT_FALSE(mgr.Find(""));
  // A full table drops the one used longest ago.
  const WebSession c = mgr.Create("c", 1, false);
  env.Advance(kSecond);
  const WebSession d = mgr.Create("d", 2, false);
  env.Advance(kSecond);
  const WebSession e = mgr.Create("e", 3, false);
  env.Advance(kSecond);
  ASSERT_TRUE(mgr.Find(c.token));
  const WebSession f = mgr.Create("f", 4, false);
  EXPECT_TRUE(mgr.Find(c.token) && mgr.Find(e.token) && mgr.Find(f.token));
  EXPECT_FALSE(mgr.Find(d.token));
  mgr.Remove(c.token);
  EXPECT_FALSE(mgr.Find(c.token));
}

TEST(LoginLimiterTest, FailuresAreCountedPerAddressAndPerAccountOverAWindow) {
  test::FakeEnv env;
  LoginLimiter limiter(4, 2, 100 * kSecond);
  limiter.Failed("10.0.0.1", "ann");
  EXPECT_EQ(limiter.WaitSeconds("10.0.0.1", "ann"), 0);
  env.Advance(30 * kSecond);
  limiter.Failed("10.0.0.2", "ann");
  // Two failures for ann: she waits until the first leaves the window, from any address.
  EXPECT_EQ(limiter.WaitSeconds("10.0.0.3", "ann"), 70);
  EXPECT_EQ(limiter.WaitSeconds("10.0.0.1", "bob"), 0);
  limiter.Failed("10.0.0.1", "bob");
  limiter.Failed("10.0.0.1", "carl");
  limiter.Failed("10.0.0.1", "dave");
  // One address trying many accounts is held too.
  EXPECT_EQ(limiter.WaitSeconds("10.0.0.1", "erin"), 70);
  EXPECT_EQ(limiter.WaitSeconds("10.0.0.9", "erin"), 0);
  limiter.Succeeded("ann");
  EXPECT_EQ(limiter.WaitSeconds("10.0.0.3", "ann"), 0);
  env.Advance(100 * kSecond);
  EXPECT_EQ(limiter.WaitSeconds("10.0.0.1", "erin"), 0);
}

}  // namespace
}  // namespace webd
}  // namespace orvane
