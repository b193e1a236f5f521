// A share's sync run end to end: the client driver against the server's
// real daemon and handler on loopback.
#include <filesystem>

#include "S2S/rsyncer.h"
#include "appliances.h"
#include "gtest/gtest.h"

namespace {

using S2S::Rsyncer;
using s2s_test::ReadFile;
using s2s_test::WriteFile;

class RsyncerSyncTest : public ::testing::Test {
 protected:
  s2s_test::Appliances app_{S2S_CMD_HANDLER};
};

TEST_F(RsyncerSyncTest, PairStartPushFinish) {
  ASSERT_TRUE(app_.AddShare("docs"));
  ASSERT_TRUE(app_.StartServer()) << app_.DaemonLog();
  ASSERT_TRUE(WriteFile(app_.ClientShare("docs") + "/a.txt", "alpha"));

  Rsyncer r;
  ASSERT_EQ(0, r.Initialize(app_.Info())) << app_.DaemonLog();
  EXPECT_EQ(1, r.GetServerVersionValue());
  EXPECT_TRUE(r.SupportMultiSource());

  int status = -1;
  std::list<std::string> conflicts;
  ASSERT_EQ(0, r.DoPairing(false, {"docs"}, conflicts, status));
  EXPECT_EQ(0, status);
  EXPECT_TRUE(conflicts.empty());
  ASSERT_EQ(0, r.StartSyncShare("docs", status));
  EXPECT_EQ(0, status);
  ASSERT_EQ(0, r.RunSync(1, "docs", "/", {}, status));
  EXPECT_EQ(0, status) << app_.DaemonLog();
  EXPECT_EQ("alpha", ReadFile(app_.ServerShare("docs") + "/a.txt"));
  ASSERT_EQ(0, r.FinishSync("share", "docs", status));
  EXPECT_EQ(0, status);
}

}  // namespace
