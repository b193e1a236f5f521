// Pairing: one request per client for an old server, the share list for a
// multi-source one, and the conflicts a second client runs into; the
// attributes of a sync start, and when it falls back to the plain form.
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
  s2s_test::Appliances app_{S2S_CMD_HANDLER};
};

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
  s2s_test::TempDir dir;
  s2s_test::ScriptedServer server(dir.path());
  ASSERT_TRUE(server.Start(app_.user(), "scripted-Pw-2"));
  server.Answer("S2S_GetProtocolVer", 0, "2\n");
  S2S::SyncInfo info = app_.Info();
  info.SetPassword("scripted-Pw-2");
  Rsyncer r;
  ASSERT_EQ(0, r.Initialize(info));
  ASSERT_TRUE(r.SupportMultiSource());
  auto request = [&server] {
    return server.LastRequest("S2S_PairingMultiSrc");
  };
  int status = -1;
  Names conflicts;
  server.Answer("S2S_PairingMultiSrc", 214, "a:b\nignored:line\n");
  ASSERT_EQ(0, r.DoPairing(true, {"docs"}, conflicts, status));
  EXPECT_EQ(214, status);
  EXPECT_EQ((Names{"a", "b"}), conflicts);
  EXPECT_TRUE(
      Has(request(), "syncShares=\"docs\"\ndryRun=\"yes\"\noutfile=\""));
  EXPECT_TRUE(Has(request(), "requireEncryptionShareSupport=\"no\"\n"));

  // The first encrypted share ends the look-ups: "nope" is never asked for.
  conflicts.clear();
  server.Answer("S2S_PairingMultiSrc", 0, "");
  ASSERT_EQ(0,
            r.DoPairing(false, {"docs", "vault", "nope"}, conflicts, status));
  EXPECT_EQ(0, status);
  EXPECT_TRUE(conflicts.empty());
  EXPECT_TRUE(Has(request(), "syncShares=\"docs:vault:nope\"\n"));
  EXPECT_TRUE(Has(request(), "dryRun=\"no\"\n"));
  EXPECT_TRUE(Has(request(), "requireEncryptionShareSupport=\"yes\"\n"));

  LogCapture log;
  server.Answer("S2S_PairingMultiSrc", 5);
  EXPECT_EQ(-1, r.DoPairing(true, {"docs"}, conflicts, status));
  EXPECT_EQ(5, status);
  EXPECT_TRUE(Has(log.Text(), "Fail to check share pairing [5]\n"));
  EXPECT_TRUE(std::filesystem::is_empty(app_.client_root() + "/tmp/S2S"));

  // A sync start falls back to the plain form after 202 only (see the old
  // server above), not after any other refusal.
  server.Answer("S2S_SyncStart", 5);
  int before = server.Count();
  ASSERT_EQ(0, r.StartSyncShare("docs", status));
  EXPECT_EQ(5, status);
  EXPECT_EQ(before + 1, server.Count());
  EXPECT_TRUE(Has(server.LastRequest("S2S_SyncStart"), "lenEncKey=\"0\"\n"));

  // Refusals before any request is sent.
  before = server.Count();
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
  EXPECT_EQ(before, server.Count());
  for (const char* line : {"): Fail to get client id\n",
                           "MultiPairing: Fail to write command file\n",
                           "SinglePairing: Fail to write command file\n",
                           "Fail to test connection\n"}) {
    EXPECT_TRUE(Has(log.Text(), line)) << line;
  }
  // No temporary directory: no place for the answer.
  std::filesystem::remove_all(app_.client_root() + "/tmp/S2S");
  EXPECT_EQ(-1, r.DoMultiPairing(true, false, {"docs"}, conflicts, status));
  EXPECT_TRUE(Has(log.Text(), "MultiPairing: Fail to get output file\n"));
  EXPECT_EQ(2, r.GetServerVersion());
  EXPECT_TRUE(Has(log.Text(), "GetServerVersion: Fail to get output file\n"));
}

}  // namespace
