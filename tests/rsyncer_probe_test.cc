// Probing a server: which address answers, what version it speaks, and how
// the probe ends when nothing answers in time.
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <filesystem>

#include "S2S/rsyncer.h"
#include "appliances.h"
#include "gtest/gtest.h"

namespace {

using S2S::Rsyncer;
using s2s_test::Has;
using s2s_test::LogCapture;

class RsyncerProbeTest : public ::testing::Test {
 protected:
  s2s_test::Appliances app_{S2S_CMD_HANDLER};
};

TEST_F(RsyncerProbeTest, FirstCandidateThatAnswersWinsAndFailuresSayWhy) {
  ASSERT_TRUE(app_.AddShare("docs"));
  ASSERT_TRUE(app_.StartServer()) << app_.DaemonLog();
  // The daemon listens on 127.0.0.1 only: .2 refuses, .3 is never tried.
  ASSERT_TRUE(s2s_test::WriteFile(app_.client_root() + "/etc/hosts",
                                  "127.0.0.2 backup-nas\n127.0.0.1 backup-nas\n"
                                  "127.0.0.3 backup-nas\n"));
  S2S::SyncInfo info = app_.Info();
  info.SetServerIP("");
  info.SetServerName("backup-nas");
  LogCapture log;
  Rsyncer r;
  ASSERT_EQ(0, r.Initialize(info));
  EXPECT_EQ("127.0.0.1", r.GetSyncInfo().GetServerIP());
  EXPECT_EQ(1, r.GetServerVersionValue());
  for (const char* line :
       {"[INFO] S2S/rsyncer(", "Test 127.0.0.2 is reachable\n",
        "Fail to test connection [10]\n", "Get server version [1]\n"}) {
    EXPECT_TRUE(Has(log.Text(), line)) << line;
  }
  EXPECT_FALSE(Has(log.Text(), "127.0.0.3"));
  // A dry-run pairing is only a question: nothing is recorded.
  EXPECT_FALSE(
      Has(s2s_test::ReadFile(app_.server_root() + "/usr/karo/etc/karoS2S.info"),
          "CLIENT-A"));

  info.SetServerName("unknown-nas");
  log.Clear();
  Rsyncer other;
  EXPECT_EQ(42, other.Initialize(info));
  EXPECT_TRUE(Has(log.Text(), "Fail to lookup ip for unknown-nas()\n"));
  EXPECT_FALSE(Has(log.Text(), "is reachable"));
  EXPECT_EQ(-1, other.GetServerVersionValue());

  // A wrong password: the last connection status, and no password logged.
  S2S::SyncInfo wrong = app_.Info();
  wrong.SetPassword("not-the-password");
  log.Clear();
  EXPECT_EQ(5, other.Initialize(wrong));
  EXPECT_TRUE(Has(log.Text(), "Fail to test connection [5]\n"));
  EXPECT_TRUE(
      Has(log.Text(), "Fail to find rsync reachable ip for (127.0.0.1)\n"));
  EXPECT_FALSE(Has(log.Text(), "not-the-password"));
  EXPECT_EQ(-1, other.GetServerVersionValue());

  // Right password: found. Then the server goes away; the version learnt
  // before still makes the next probe a success.
  ASSERT_EQ(0, other.Initialize(app_.Info()));
  app_.StopServer();
  s2s_test::ScopedEnv port("S2S_RSYNC_PORT",
                           std::to_string(s2s_test::FreeLoopbackPort()));
  log.Clear();
  EXPECT_EQ(0, other.Initialize(app_.Info()));
  EXPECT_TRUE(Has(log.Text(), "Fail to test connection [10]\n"));
  EXPECT_EQ(1, other.GetServerVersionValue());
  Rsyncer fresh;
  EXPECT_EQ(10, fresh.Initialize(app_.Info()));
}

// The owner's patience: the checker says stop once the deadline passed.
std::atomic<std::chrono::steady_clock::rep> deadline{0};
bool PastDeadline() {
  return std::chrono::steady_clock::now().time_since_epoch().count() >
         deadline.load();
}

TEST_F(RsyncerProbeTest, SilentPeerEndsWhenTheOwnerGivesUp) {
  // Accepts connections (the kernel's backlog does) and never says a word.
  int silent = 0;
  int fd = s2s_test::LoopbackListener(&silent);
  ASSERT_GE(fd, 0);
  s2s_test::ScopedEnv port("S2S_RSYNC_PORT", std::to_string(silent));
  Rsyncer r;
  r.SetCancelChecker(&PastDeadline);
  auto start = std::chrono::steady_clock::now();
  deadline =
      (start + std::chrono::milliseconds(300)).time_since_epoch().count();
  LogCapture log;
  EXPECT_NE(0, r.Initialize(app_.Info()));
  EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(3));
  close(fd);
  EXPECT_TRUE(Has(log.Text(), "Fail to test connection [20]\n"));
  EXPECT_EQ(-1, r.GetServerVersionValue());
}

TEST_F(RsyncerProbeTest, ScriptedVersionAnswers) {
  s2s_test::TempDir dir;
  s2s_test::ScriptedServer server(dir.path());
  ASSERT_TRUE(server.Start(app_.user(), "scripted-Pw-1"));
  S2S::SyncInfo info = app_.Info();
  info.SetPassword("scripted-Pw-1");

  // A dry-run pairing answered with 207 counts as reachable.
  server.Answer("S2S_Pairing", 207);
  server.Answer("S2S_GetProtocolVer", 0, "  3\n");
  Rsyncer r;
  ASSERT_EQ(0, r.Initialize(info)) << server.daemon().Log();
  EXPECT_EQ(3, r.GetServerVersionValue());
  EXPECT_TRUE(r.SupportMultiSource());
  EXPECT_TRUE(Has(server.LastRequest("S2S_Pairing"),
                  "command=\"S2S_Pairing\"\nclientID=\"CLIENT-A\"\n"
                  "dryRun=\"yes\"\nserverName=\"client-a\"\n"));
  EXPECT_TRUE(Has(server.LastRequest("S2S_GetProtocolVer"), "outfile=\""));
  int status = -1;
  EXPECT_EQ(0, r.TestProtocol(status));
  EXPECT_EQ(0, status);

  // Either "unknown command" status means protocol 0.
  for (int old : {43, 51}) {
    server.Answer("S2S_GetProtocolVer", old);
    Rsyncer o;
    ASSERT_EQ(0, o.Initialize(info));
    EXPECT_EQ(0, o.GetServerVersionValue());
    EXPECT_FALSE(o.SupportMultiSource());
  }
  // Garbage instead of a number: -1, the probe goes on and fails.
  server.Answer("S2S_GetProtocolVer", 0, "three\n");
  LogCapture log;
  Rsyncer g;
  EXPECT_EQ(0, g.Initialize(info));
  EXPECT_EQ(-1, g.GetServerVersionValue());
  EXPECT_TRUE(Has(log.Text(), "Fail to find rsync reachable ip"));
  // Any other status keeps the version held.
  server.Answer("S2S_GetProtocolVer", 240);
  EXPECT_EQ(3, r.GetServerVersion());
  EXPECT_TRUE(Has(log.Text(), "Fail to get server version [240]\n"));
  server.Answer("S2S_Pairing", 245);
  EXPECT_EQ(0, r.TestProtocol(status));
  EXPECT_EQ(245, status);
  EXPECT_TRUE(Has(log.Text(), "Fail to test connection [245]\n"));
  // No temporary file is left behind.
  EXPECT_TRUE(std::filesystem::is_empty(app_.client_root() + "/tmp/S2S"));
}

}  // namespace
