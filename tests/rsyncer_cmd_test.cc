// A server command's client side without a server: each run's wrapper
// settings, each request's lines, the checks before it, answers split.
#include <list>
#include <string>
#include <vector>

#include "S2S/rsyncer.h"
#include "gtest/gtest.h"
#include "testutil.h"

namespace {

using S2S::Rsyncer;
using s2s_test::Has;
using Lines = std::list<std::string>;

class RsyncerCmdTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_TRUE(root_.Write(
        "/etc/s2s/platform.conf",
        "[Platform]\n\tserial=\"SN-9\"\n\thostname=\"" + kHost + "\"\n"));
    ASSERT_TRUE(root_.MakeDir("/data/plain"));
    ASSERT_TRUE(root_.MakeDir("/data/@locked@"));
    // "plain" reports a key length although it is not encrypted.
    ASSERT_TRUE(root_.Write(
        "/etc/s2s/shares.conf",
        "[plain]\n\tpath=\"" + root_.Path("/data/plain") +
            "\"\n\tvolume=\"/volume1\"\n\tkey_length=\"16\"\n"
            "[locked]\n\tpath=\"" +
            root_.Path("/data/locked") +
            "\"\n\tvolume=\"/volume2\"\n\tencrypted=\"yes\"\n"
            "\tauto_mount=\"yes\"\n\twin_share=\"yes\"\n\tkey_length=\"32\"\n"
            "[nomount]\n\tpath=\"/no/mount/holds/this\"\n"));
    // A mount table that holds none of the shares without a volume key.
    ASSERT_TRUE(root_.Write("/etc/mtab", "/dev/sdz1 /elsewhere ext4 rw 0 0\n"));
  }
  // What a generator appended to out_ (after its first line, which it keeps
  // again), joined by '|'; "refused" when it failed and wrote nothing.
  std::string Joined(int r) {
    EXPECT_EQ(out_.front(), "kept");
    std::string joined = r == 0 ? "" : "refused";
    for (auto it = std::next(out_.begin()); it != out_.end(); ++it)
      joined += (it == std::next(out_.begin()) ? "" : "|") + *it;
    out_ = {"kept"};
    return joined;
  }

  // A host name longer than the 35 characters a request carries.
  const std::string kHost = "nas-one-of-the-many-storage-servers-in-a-rack";
  s2s_test::TempRoot root_;
  Rsyncer r_;
  Lines out_ = {"kept"};
};

TEST_F(RsyncerCmdTest, EveryRequestsLinesAndTheRefusalsThatWriteNothing) {
  s2s_test::LogCapture log;
  const std::string id = "clientID=\"SN-9\"|";
  const std::string server =
      "serverName=\"nas-one-of-the-many-storage-servers\"";
  EXPECT_EQ(Joined(r_.GenSinglePairCmd(false, out_)),
            "command=\"S2S_Pairing\"|" + id + "dryRun=\"no\"|" + server);
  EXPECT_EQ(Joined(r_.GenServerVersionCmd("/o", out_)),
            "command=\"S2S_GetProtocolVer\"|" + id + "outfile=\"/o\"");
  EXPECT_EQ(
      Joined(r_.GenSendBeaconCmd("nightly run", out_)),
      "command=\"S2S_UpdateTaskStatus\"|" + id + "taskName=\"nightly run\"");
  EXPECT_EQ(Joined(r_.GenFinishSyncCmd("share", "plain", out_)),
            "command=\"S2S_SyncFinish\"|" + id +
                "finishType=\"share\"|name=\"plain\"");
  // Nothing is escaped: the server has to cope with what it gets.
  EXPECT_EQ(
      Joined(r_.GenPairMultiSrcCmd(false, true, {"x\"y", "p:q"}, "/o", out_)),
      "command=\"S2S_PairingMultiSrc\"|" + id + server +
          "|syncShares=\"x\"y:p:q\"|dryRun=\"no\"|outfile=\"/o\"|"
          "requireEncryptionShareSupport=\"yes\"");
  EXPECT_EQ(Joined(r_.GenStartSyncShareCmd("locked", false, out_)),
            "command=\"S2S_SyncStart\"|" + id +
                "volumeName=\"volume2\"|shareName=\"locked\"");
  EXPECT_EQ(Joined(r_.GenStartSyncShareCmd("locked", true, out_)),
            "command=\"S2S_SyncStart\"|" + id +
                "volumeName=\"volume2\"|shareName=\"locked\"|isEncrypt=\"1\"|"
                "isAutomount=\"1\"|isEnableACL=\"1\"|isWinShare=\"1\"|"
                "lenEncKey=\"32\"");
  EXPECT_EQ(Joined(r_.GenStartSyncShareCmd("plain", true, out_)),
            "command=\"S2S_SyncStart\"|" + id +
                "volumeName=\"volume1\"|shareName=\"plain\"|isEncrypt=\"0\"|"
                "isAutomount=\"0\"|isEnableACL=\"0\"|isWinShare=\"0\"|"
                "lenEncKey=\"16\"");
  EXPECT_EQ(Joined(r_.GenSendBeaconCmd("", out_)), "refused");
  EXPECT_EQ(Joined(r_.GenFinishSyncCmd("", "plain", out_)), "refused");
  EXPECT_EQ(Joined(r_.GenFinishSyncCmd("share", "", out_)), "refused");
  EXPECT_EQ(Joined(r_.GenStartSyncShareCmd("", true, out_)), "refused");
  EXPECT_EQ(Joined(r_.GenStartSyncShareCmd("nope", true, out_)), "refused");
  EXPECT_EQ(Joined(r_.GenStartSyncShareCmd("nomount", false, out_)), "refused");
  EXPECT_EQ(Joined(r_.GenPairMultiSrcCmd(true, false, {}, "/o", out_)),
            "refused");
  s2s_test::ExpectHas(
      log.Text(),
      {"[ERROR] S2S/rsyncer(", "GenFinishSyncCmd: Empty parameter\n",
       "Fail to get share info of 'nope'\n", "Fail to get volume info\n"});
}

TEST(RsyncerSplitTest, SplitsAtEachSeparatorKeepingEmptyPieces) {
  struct Case {
    std::string text, separators;
    std::vector<std::string> pieces;
  } cases[] = {
      {"a:b", ":", {"a", "b"}},
      {"a::b", ":", {"a", "", "b"}},
      {"a,b:c", ":,", {"a", "b", "c"}},
      {":a:", ":", {"", "a", ""}},
      {"", ":", {""}},
      {"a:b", "", {"a:b"}},
      // A set of characters, not a substring.
      {"a:,b", ",:", {"a", "", "b"}},
  };
  for (const Case& c : cases) {
    std::list<std::string> out = {"before"};
    EXPECT_EQ(0, Rsyncer::SplitStringByChars(c.text, c.separators, out));
    std::vector<std::string> expected = {"before"};
    expected.insert(expected.end(), c.pieces.begin(), c.pieces.end());
    EXPECT_EQ(expected, std::vector<std::string>(out.begin(), out.end()))
        << "'" << c.text << "' at '" << c.separators << "'";
  }
}

// What the Rsyncer copies into the wrapper settings of a run.
TEST(RsyncerTaskTest, SwitchesAndConnection) {
  Rsyncer::RsyncTask task;
  // Block-level sync is rsync's delta transfer, not its compression.
  task.SetBlockLevelSync(true);
  EXPECT_TRUE(task.getDeltaCopy());
  EXPECT_FALSE(task.getCompress());

  S2S::SyncInfo info;
  info.SetSSHPort(2222);
  info.SetCompression(true);
  Rsyncer r;
  for (bool ssh : {false, true}) {
    info.SetSSH(ssh);
    r.Resume(info, 1);
    Rsyncer::RsyncTask t;
    r.InitRsyncTask(t, !ssh);
    EXPECT_EQ(ssh, t.getSsh());
    EXPECT_EQ(ssh ? 2222u : 0u, t.getPort());  // the port only for SSH
    EXPECT_EQ(ssh, t.getDebugLog());           // a test task runs quietly
    EXPECT_FALSE(t.getCompress());  // transfer options are the callers'
  }
}

}  // namespace
