#include <gtest/gtest.h>
#include <sys/stat.h>
#include <time.h>
#include <unistd.h>

#include <string>

#include "S2S/is_syncedshare.h"
#include "testutil.h"

namespace {

using s2s_test::TempRoot;
using s2s_test::WriteFile;

class StatusTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_EQ(S2SCheckServerInfo(), 0);
    ASSERT_TRUE(root_.MakeDir("/var/run"));
  }
  void SetTask(const char* task, const std::string& status) {
    KSZHASH* h = KLIBCSzHashAlloc(4);
    KLIBCSzHashSetValue(h, "status", status.c_str());
    ASSERT_EQ(S2SServerUpdateTask(task, h), 0);
    KLIBCSzHashFree(h);
  }
  int Busy() {
    S2S_SVR_STATUS st;
    EXPECT_EQ(s2s_svr_get_status(&st), 0);
    s2s_svr_put_status(&st);
    return st.busy;
  }
  // The busy flag for one task `age` seconds old. Retried when the clock
  // ticks between writing the time and reading the status.
  int BusyAtAge(long age) {
    for (;;) {
      time_t before = time(nullptr);
      SetTask("t1", std::to_string(static_cast<long>(before) - age));
      int busy = Busy();
      if (time(nullptr) == before) return busy;
    }
  }
  TempRoot root_;
};

TEST_F(StatusTest, BusyWhileATaskWasActiveWithin119Seconds) {
  EXPECT_EQ(BusyAtAge(0), 1);
  EXPECT_EQ(BusyAtAge(119), 1);
  EXPECT_EQ(BusyAtAge(120), 0);
  SetTask("t1", "idle");
  SetTask("t2", std::to_string(time(nullptr)));
  EXPECT_EQ(Busy(), 1);  // any task counts, not just the first
  SetTask("t2", "idle");
  EXPECT_EQ(Busy(), 0);
}

TEST_F(StatusTest, RunningNeedsTheSwitchAndALiveDaemon) {
  const std::string pid_file = root_.Path("/var/run/rsyncd.pid");
  S2S_SVR_STATUS st;
  EXPECT_EQ(s2s_svr_get_status(&st), 0);  // no client: null strings
  EXPECT_EQ(st.running, 0);
  EXPECT_EQ(st.busy, 0);
  EXPECT_EQ(st.clientID, nullptr);
  EXPECT_EQ(st.serverName, nullptr);
  s2s_svr_put_status(&st);

  ASSERT_EQ(KAROUISetS2S(1, "c1", "srv1"), 0);
  s2s_svr_get_status(&st);
  EXPECT_EQ(st.running, 0);  // no daemon
  EXPECT_STREQ(st.clientID, "c1");
  EXPECT_STREQ(st.serverName, "srv1");
  EXPECT_EQ(s2s_svr_put_status(&st), 0);
  EXPECT_EQ(st.clientID, nullptr);

  // This test process stands in for a live daemon.
  ASSERT_TRUE(WriteFile(pid_file, std::to_string(getpid()) + "\n"));
  s2s_svr_get_status(&st);
  EXPECT_EQ(st.running, 1);
  s2s_svr_put_status(&st);
  ASSERT_EQ(KAROUISetS2S(0, nullptr, nullptr), 0);
  s2s_svr_get_status(&st);
  EXPECT_EQ(st.running, 0);
  s2s_svr_put_status(&st);
  EXPECT_EQ(s2s_svr_get_status(nullptr), 0);
  EXPECT_EQ(s2s_svr_put_status(nullptr), 0);
}

}  // namespace
