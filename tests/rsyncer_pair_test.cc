// Probing a server: the address that answers, its version, silence. Pairing
// with old and multi-source servers, a second client's conflicts, and a sync
// start's attributes with their plain fallback.
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
using s2s_test::ReadFile;
using s2s_test::WriteFile;
using Names = std::list<std::string>;

class RsyncerPairTest : public ::testing::Test {
 protected:
  // Starts the scripted server instead of the real one; the client's view.
  S2S::SyncInfo StartScripted() {
    EXPECT_TRUE(server_.Start(app_.user(), "scripted-Pw-1"));
    S2S::SyncInfo info = app_.Info();
    info.SetPassword("scripted-Pw-1");
    return info;
  }

  s2s_test::Appliances app_{S2S_CMD_HANDLER};
  s2s_test::TempDir dir_;
  s2s_test::ScriptedServer server_{dir_.path()};
};
class RsyncerProbeTest : public RsyncerPairTest {};

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
  s2s_test::ExpectHas(
      log.Text(),
      {"[INFO] S2S/rsyncer(", "Test 127.0.0.2 is reachable\n",
       "Fail to test connection [10]\n", "Get server version [1]\n"});
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

  // Found. With the server gone, the version learnt still makes it succeed.
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
  const S2S::SyncInfo info = StartScripted();

  // A dry-run pairing answered with 207 counts as reachable.
  server_.Answer("S2S_Pairing", 207);
  server_.Answer("S2S_GetProtocolVer", 0, "  3\n");
  Rsyncer r;
  ASSERT_EQ(0, r.Initialize(info)) << server_.daemon().Log();
  EXPECT_EQ(3, r.GetServerVersionValue());
  EXPECT_TRUE(r.SupportMultiSource());
  EXPECT_TRUE(Has(server_.LastRequest("S2S_Pairing"),
                  "command=\"S2S_Pairing\"\nclientID=\"CLIENT-A\"\n"
                  "dryRun=\"yes\"\nserverName=\"client-a\"\n"));
  EXPECT_TRUE(Has(server_.LastRequest("S2S_GetProtocolVer"), "outfile=\""));
  int status = -1;
  EXPECT_EQ(0, r.TestProtocol(status));
  EXPECT_EQ(0, status);

  // Either "unknown command" status means protocol 0.
  for (int old : {43, 51}) {
    server_.Answer("S2S_GetProtocolVer", old);
    Rsyncer o;
    ASSERT_EQ(0, o.Initialize(info));
    EXPECT_EQ(0, o.GetServerVersionValue());
    EXPECT_FALSE(o.SupportMultiSource());
  }
  // Garbage instead of a number: -1, the probe goes on and fails.
  server_.Answer("S2S_GetProtocolVer", 0, "three\n");
  LogCapture log;
  Rsyncer g;
  EXPECT_EQ(0, g.Initialize(info));
  EXPECT_EQ(-1, g.GetServerVersionValue());
  EXPECT_TRUE(Has(log.Text(), "Fail to find rsync reachable ip"));
  // Any other status keeps the version held.
  server_.Answer("S2S_GetProtocolVer", 240);
  EXPECT_EQ(3, r.GetServerVersion());
  EXPECT_TRUE(Has(log.Text(), "Fail to get server version [240]\n"));
  server_.Answer("S2S_Pairing", 245);
  EXPECT_EQ(0, r.TestProtocol(status));
  EXPECT_EQ(245, status);
  EXPECT_TRUE(Has(log.Text(), "Fail to test connection [245]\n"));
  // No temporary file is left behind.
  EXPECT_TRUE(std::filesystem::is_empty(app_.client_root() + "/tmp/S2S"));
}

TEST_F(RsyncerPairTest, SecondClientMeetsTheSharesTheFirstFeeds) {
  ASSERT_TRUE(app_.AddShare("docs"));
  ASSERT_TRUE(app_.AddShare("pics"));
  ASSERT_TRUE(app_.AddShare("misc"));
  ASSERT_TRUE(app_.StartServer()) << app_.DaemonLog();
  std::string clientB = app_.AddClient("CLIENT-B");

  Rsyncer a;
  ASSERT_EQ(0, a.Initialize(app_.Info()));
  int status = -1;
  Names conflicts;
  ASSERT_EQ(0, a.DoPairing(false, {"docs", "pics"}, conflicts, status));
  EXPECT_EQ(0, status);
  EXPECT_TRUE(conflicts.empty());
  // docs: a completed sync; pics: one still running.
  ASSERT_EQ(0, a.StartSyncShare("docs", status));
  ASSERT_EQ(0, status);
  ASSERT_EQ(0, a.FinishSync("share", "docs", status));
  ASSERT_EQ(0, status);
  ASSERT_EQ(0, a.StartSyncShare("pics", status));
  ASSERT_EQ(0, status);

  app_.Enter(clientB);
  Rsyncer b;
  ASSERT_EQ(0, b.Initialize(app_.Info()));
  status = -1;
  ASSERT_EQ(0, b.DoPairing(true, {"docs", "misc", "pics"}, conflicts, status));
  EXPECT_EQ(214, status);
  EXPECT_EQ((Names{"docs", "pics"}), conflicts);
  conflicts.clear();
  ASSERT_EQ(0, b.DoPairing(false, {"misc"}, conflicts, status));
  EXPECT_EQ(0, status);
  EXPECT_TRUE(conflicts.empty());
  EXPECT_EQ("client-CLIENT-B",
            app_.ServerRegistry("CLIENTID_CLIENT-B", "ServerName"));
  EXPECT_TRUE(std::filesystem::is_empty(clientB + "/tmp/S2S"));
}

TEST_F(RsyncerPairTest, OldServerGetsTheSingleRequestAndThePlainSyncStart) {
  ASSERT_TRUE(app_.AddShare("docs"));
  ASSERT_TRUE(app_.StartServer(/*old_server=*/true)) << app_.DaemonLog();
  ASSERT_TRUE(WriteFile(app_.ClientShare("docs") + "/f", "old"));
  Rsyncer r;
  ASSERT_EQ(0, r.Initialize(app_.Info()));
  EXPECT_EQ(0, r.GetServerVersionValue());
  EXPECT_FALSE(r.SupportMultiSource());

  // The share list goes unused, even a share nobody knows.
  Names conflicts = {"stale"};
  int status = -1;
  ASSERT_EQ(0, r.DoPairing(false, {"docs", "nope"}, conflicts, status));
  EXPECT_EQ(0, status);
  EXPECT_TRUE(conflicts.empty());
  EXPECT_EQ("CLIENT-A", app_.ServerRegistry("PairedClientInfo", "clientID"));
  EXPECT_EQ("client-a", app_.ServerRegistry("PairedClientInfo", "serverName"));
  // Asked again, the server names this client as the paired one.
  ASSERT_EQ(0, r.DoSinglePairing(true, status));
  EXPECT_EQ(207, status);

  // Attributes refused (202), then the plain form is taken.
  LogCapture log;
  ASSERT_EQ(0, r.StartSyncShare("docs", status));
  EXPECT_EQ(0, status);
  EXPECT_FALSE(Has(log.Text(), "[ERROR]"));
  EXPECT_EQ("CLIENT-A", app_.ServerRegistry("SHARE_docs", "RunningID"));
  ASSERT_EQ(0, r.RunSync(7, "docs", "/", {}, status));
  EXPECT_EQ(0, status);
  EXPECT_EQ("old", ReadFile(app_.ServerShare("docs") + "/f"));

  // Another client cannot take over a single-client server.
  app_.Enter(app_.AddClient("CLIENT-B"));
  Rsyncer b;
  EXPECT_EQ(245, b.Initialize(app_.Info()));
  ASSERT_EQ(0, b.DoPairing(false, {"docs"}, conflicts, status));
  EXPECT_EQ(245, status);
}

// Answers the real handler never gives, and the lines that cross the wire.
TEST_F(RsyncerPairTest, ScriptedAnswersAndRefusalsBeforeAnyRun) {
  ASSERT_TRUE(app_.AddShare("docs"));
  ASSERT_TRUE(app_.AddShare("vault", /*encrypted=*/true));
  const S2S::SyncInfo info = StartScripted();
  server_.Answer("S2S_GetProtocolVer", 0, "2\n");
  Rsyncer r;
  ASSERT_EQ(0, r.Initialize(info));
  ASSERT_TRUE(r.SupportMultiSource());
  auto request = [this] { return server_.LastRequest("S2S_PairingMultiSrc"); };
  int status = -1;
  Names conflicts;
  server_.Answer("S2S_PairingMultiSrc", 214, "a:b\nignored:line\n");
  ASSERT_EQ(0, r.DoPairing(true, {"docs"}, conflicts, status));
  EXPECT_EQ(214, status);
  EXPECT_EQ((Names{"a", "b"}), conflicts);
  EXPECT_TRUE(
      Has(request(), "syncShares=\"docs\"\ndryRun=\"yes\"\noutfile=\""));
  EXPECT_TRUE(Has(request(), "requireEncryptionShareSupport=\"no\"\n"));

  // The first encrypted share ends the look-ups: "nope" is never asked for.
  conflicts.clear();
  server_.Answer("S2S_PairingMultiSrc", 0, "");
  ASSERT_EQ(0,
            r.DoPairing(false, {"docs", "vault", "nope"}, conflicts, status));
  EXPECT_EQ(0, status);
  EXPECT_TRUE(conflicts.empty());
  EXPECT_TRUE(Has(request(), "syncShares=\"docs:vault:nope\"\n"));
  EXPECT_TRUE(Has(request(), "dryRun=\"no\"\n"));
  EXPECT_TRUE(Has(request(), "requireEncryptionShareSupport=\"yes\"\n"));

  LogCapture log;
  server_.Answer("S2S_PairingMultiSrc", 5);
  EXPECT_EQ(-1, r.DoPairing(true, {"docs"}, conflicts, status));
  EXPECT_EQ(5, status);
  EXPECT_TRUE(Has(log.Text(), "Fail to check share pairing [5]\n"));
  EXPECT_TRUE(std::filesystem::is_empty(app_.client_root() + "/tmp/S2S"));

  // A sync start falls back to the plain form after 202 only.
  server_.Answer("S2S_SyncStart", 5);
  int before = server_.Count();
  ASSERT_EQ(0, r.StartSyncShare("docs", status));
  EXPECT_EQ(5, status);
  EXPECT_EQ(before + 1, server_.Count());
  EXPECT_TRUE(Has(server_.LastRequest("S2S_SyncStart"), "lenEncKey=\"0\"\n"));

  // Refusals before any request is sent.
  before = server_.Count();
  status = -7;
  EXPECT_EQ(-1,
            r.DoPairing(true, {"docs", "nope", "vault"}, conflicts, status));
  EXPECT_TRUE(Has(log.Text(), "Fail to get share info of 'nope'\n"));
  EXPECT_EQ(-1, r.DoPairing(true, {}, conflicts, status));
  EXPECT_TRUE(Has(log.Text(), "MultiPairing: Share list is empty\n"));
  // Without a client identity no request can be written.
  ASSERT_TRUE(WriteFile(app_.client_root() + "/etc/s2s/platform.conf",
                        "[Platform]\n\tha=\"yes\"\n\tserial=\"\"\n"));
  EXPECT_EQ(-1, r.DoPairing(true, {"docs"}, conflicts, status));
  EXPECT_EQ(-1, r.DoSinglePairing(true, status));
  EXPECT_EQ(-1, r.TestProtocol(status));
  EXPECT_EQ(-7, status);
  EXPECT_EQ(before, server_.Count());
  s2s_test::ExpectHas(log.Text(),
                      {"): Fail to get client id\n",
                       "MultiPairing: Fail to write command file\n",
                       "SinglePairing: Fail to write command file\n",
                       "Fail to test connection\n"});
  // No temporary directory: no place for the answer.
  std::filesystem::remove_all(app_.client_root() + "/tmp/S2S");
  EXPECT_EQ(-1, r.DoMultiPairing(true, false, {"docs"}, conflicts, status));
  EXPECT_TRUE(Has(log.Text(), "MultiPairing: Fail to get output file\n"));
  EXPECT_EQ(2, r.GetServerVersion());
  EXPECT_TRUE(Has(log.Text(), "GetServerVersion: Fail to get output file\n"));
}

}  // namespace
