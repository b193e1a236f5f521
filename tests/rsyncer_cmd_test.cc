// The command files of the client: exact lines of every request, the checks
// made before anything is written, and the splitting of the server's
// answers. No server is involved.
#include <list>
#include <string>
#include <vector>

#include "S2S/rsyncer.h"
#include "gtest/gtest.h"
#include "testutil.h"

namespace {

using S2S::Rsyncer;
using Lines = std::list<std::string>;

class RsyncerCmdTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_TRUE(root_.Write("/etc/s2s/platform.conf",
                            "[Platform]\n\tserial=\"SN-9\"\n"
                            "\thostname=\"nas-one\"\n"));
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

  void NoIdentity() {
    ASSERT_TRUE(root_.Write("/etc/s2s/platform.conf",
                            "[Platform]\n\tha=\"yes\"\n\tserial=\"\"\n"));
  }

  s2s_test::TempRoot root_;
  Rsyncer r_;
};

TEST_F(RsyncerCmdTest, PairingVersionBeaconAndFinishLines) {
  Lines out;
  ASSERT_EQ(0, r_.GenSinglePairCmd(true, out));
  EXPECT_EQ(out, (Lines{"command=\"S2S_Pairing\"", "clientID=\"SN-9\"",
                        "dryRun=\"yes\"", "serverName=\"nas-one\""}));
  out.clear();
  ASSERT_EQ(0, r_.GenSinglePairCmd(false, out));
  EXPECT_EQ("dryRun=\"no\"", *std::next(out.begin(), 2));

  out.clear();
  ASSERT_EQ(0, r_.GenServerVersionCmd("/tmp/S2S/temp.1", out));
  EXPECT_EQ(out, (Lines{"command=\"S2S_GetProtocolVer\"", "clientID=\"SN-9\"",
                        "outfile=\"/tmp/S2S/temp.1\""}));

  out.clear();
  ASSERT_EQ(0, r_.GenSendBeaconCmd("nightly run", out));
  EXPECT_EQ(out, (Lines{"command=\"S2S_UpdateTaskStatus\"", "clientID=\"SN-9\"",
                        "taskName=\"nightly run\""}));

  // Lines are appended to what the list holds.
  out = {"kept"};
  ASSERT_EQ(0, r_.GenFinishSyncCmd("share", "plain", out));
  EXPECT_EQ(out,
            (Lines{"kept", "command=\"S2S_SyncFinish\"", "clientID=\"SN-9\"",
                   "finishType=\"share\"", "name=\"plain\""}));
}

TEST_F(RsyncerCmdTest, ServerNameIsCutTo35Characters) {
  std::string longName(50, 'h');
  ASSERT_TRUE(root_.Write(
      "/etc/s2s/platform.conf",
      "[Platform]\n\tserial=\"SN-9\"\n\thostname=\"" + longName + "\"\n"));
  Lines single, multi;
  ASSERT_EQ(0, r_.GenSinglePairCmd(true, single));
  EXPECT_EQ("serverName=\"" + longName.substr(0, 35) + "\"", single.back());
  ASSERT_EQ(0, r_.GenPairMultiSrcCmd(false, false, {"a"}, "/o", multi));
  EXPECT_EQ("serverName=\"" + longName.substr(0, 35) + "\"",
            *std::next(multi.begin(), 2));
}

TEST_F(RsyncerCmdTest, MultiSourcePairingLines) {
  Lines out;
  ASSERT_EQ(0, r_.GenPairMultiSrcCmd(true, false, {"a", "b", "c"},
                                     "/tmp/S2S/temp.2", out));
  EXPECT_EQ(out, (Lines{"command=\"S2S_PairingMultiSrc\"", "clientID=\"SN-9\"",
                        "serverName=\"nas-one\"", "syncShares=\"a:b:c\"",
                        "dryRun=\"yes\"", "outfile=\"/tmp/S2S/temp.2\"",
                        "requireEncryptionShareSupport=\"no\""}));
  out.clear();
  ASSERT_EQ(0, r_.GenPairMultiSrcCmd(false, true, {"a"}, "/o", out));
  EXPECT_EQ("syncShares=\"a\"", *std::next(out.begin(), 3));
  EXPECT_EQ("dryRun=\"no\"", *std::next(out.begin(), 4));
  EXPECT_EQ("requireEncryptionShareSupport=\"yes\"", out.back());
  // Nothing is escaped: the server has to cope with what it gets.
  out.clear();
  ASSERT_EQ(0, r_.GenPairMultiSrcCmd(false, false, {"x\"y", "p:q"}, "/o", out));
  EXPECT_EQ("syncShares=\"x\"y:p:q\"", *std::next(out.begin(), 3));
}

TEST_F(RsyncerCmdTest, SyncStartPlainAndWithAttributes) {
  Lines out;
  ASSERT_EQ(0, r_.GenStartSyncShareCmd("locked", false, out));
  EXPECT_EQ(out, (Lines{"command=\"S2S_SyncStart\"", "clientID=\"SN-9\"",
                        "volumeName=\"volume2\"", "shareName=\"locked\""}));
  out.clear();
  ASSERT_EQ(0, r_.GenStartSyncShareCmd("locked", true, out));
  EXPECT_EQ(out,
            (Lines{"command=\"S2S_SyncStart\"", "clientID=\"SN-9\"",
                   "volumeName=\"volume2\"", "shareName=\"locked\"",
                   "isEncrypt=\"1\"", "isAutomount=\"1\"", "isEnableACL=\"1\"",
                   "isWinShare=\"1\"", "lenEncKey=\"32\""}));
  out.clear();
  ASSERT_EQ(0, r_.GenStartSyncShareCmd("plain", true, out));
  EXPECT_EQ(out,
            (Lines{"command=\"S2S_SyncStart\"", "clientID=\"SN-9\"",
                   "volumeName=\"volume1\"", "shareName=\"plain\"",
                   "isEncrypt=\"0\"", "isAutomount=\"0\"", "isEnableACL=\"0\"",
                   "isWinShare=\"0\"", "lenEncKey=\"16\""}));
}

TEST_F(RsyncerCmdTest, EmptyParametersAndUnknownSharesWriteNothing) {
  s2s_test::LogCapture log;
  Lines out;
  EXPECT_EQ(-1, r_.GenSendBeaconCmd("", out));
  EXPECT_EQ(-1, r_.GenFinishSyncCmd("", "plain", out));
  EXPECT_EQ(-1, r_.GenFinishSyncCmd("share", "", out));
  EXPECT_EQ(-1, r_.GenStartSyncShareCmd("", true, out));
  EXPECT_EQ(-1, r_.GenStartSyncShareCmd("nope", true, out));
  EXPECT_EQ(-1, r_.GenStartSyncShareCmd("nomount", false, out));
  EXPECT_EQ(-1, r_.GenPairMultiSrcCmd(true, false, {}, "/o", out));
  EXPECT_TRUE(out.empty());
  std::string text = log.Text();
  EXPECT_NE(text.find("[ERROR] S2S/rsyncer("), std::string::npos);
  for (const char* msg :
       {"GenSendBeaconCmd: Empty parameter\n",
        "GenStartSyncShareCmd: Empty parameter\n",
        "Fail to get share info of 'nope'\n", "Fail to get volume info\n",
        "GenPairMultiSrcCmd: Empty parameter\n"}) {
    EXPECT_NE(text.find(msg), std::string::npos) << msg;
  }
  size_t first = text.find("GenFinishSyncCmd: Empty parameter\n");
  ASSERT_NE(first, std::string::npos);
  EXPECT_NE(text.find("GenFinishSyncCmd: Empty parameter\n", first + 1),
            std::string::npos);
}

TEST_F(RsyncerCmdTest, MissingClientIdentityStopsEveryRequest) {
  NoIdentity();
  s2s_test::LogCapture log;
  Lines out;
  EXPECT_EQ(-1, r_.GenSinglePairCmd(true, out));
  EXPECT_EQ(-1, r_.GenServerVersionCmd("/o", out));
  EXPECT_EQ(-1, r_.GenSendBeaconCmd("t", out));
  EXPECT_EQ(-1, r_.GenFinishSyncCmd("task", "t", out));
  EXPECT_EQ(-1, r_.GenStartSyncShareCmd("plain", true, out));
  EXPECT_EQ(-1, r_.GenPairMultiSrcCmd(true, false, {"plain"}, "/o", out));
  EXPECT_TRUE(out.empty());
  int count = 0;
  for (const std::string& m : log.Messages()) {
    if (m.find("[ERROR] S2S/rsyncer(") == 0 &&
        m.find("): Fail to get client id\n") != std::string::npos) {
      ++count;
    }
  }
  EXPECT_EQ(6, count);
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
      {"abc", ":", {"abc"}},
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

}  // namespace
