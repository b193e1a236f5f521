// The server side end to end: a daemon configuration generated from the
// share configuration, the real rsync daemon on loopback running the real
// command handler, and the client's rsync wrapper.
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>

#include "daemon_config.h"
#include "gtest/gtest.h"
#include "karo/rsync_wrapper.h"
#include "protocol.h"
#include "testutil.h"

namespace {

using KARO::Backup::RsyncWrapper;
using namespace S2S::server;
using s2s_test::ReadFile;
using s2s_test::WriteFile;

const char kUser[] = "s2s";
const char kPassword[] = "daemon-Secret-91";

class ServerDaemonTest : public ::testing::Test {
 protected:
  void StartServer() {
    std::filesystem::create_directories(tmp_.Sub("etc/s2s"));
    std::filesystem::create_directories(tmp_.Sub("share1"));
    std::filesystem::create_directories(tmp_.Sub("src"));
    WriteFile(tmp_.Sub("etc/s2s/shares.conf"),
              "[share1]\n\tpath=\"" + tmp_.Sub("share1") + "\"\n");
    WriteFile(tmp_.Sub("src/file"), "payload");
    DaemonConfig config;
    config.handler = S2S_CMD_HANDLER;
    config.user = kUser;
    config.password = kPassword;
    config.uid = geteuid();
    config.gid = getegid();
    ASSERT_EQ(0, WriteDaemonConfig(config));
    struct stat st;
    ASSERT_EQ(0, stat(DaemonSecretsPath().c_str(), &st));
    EXPECT_EQ(0600u, st.st_mode & 0777);
    ASSERT_TRUE(daemon_.StartWithConfig(DaemonConfigPath())) << daemon_.Log();
    port_.reset(new s2s_test::ScopedEnv("S2S_RSYNC_PORT",
                                        std::to_string(daemon_.port())));
  }

  // Runs one command for `client`; its status.
  int Command(const std::string& client, const std::string& command,
              std::vector<std::string> params) {
    std::list<std::string> lines = {"command=\"" + command + "\"",
                                    "clientID=\"" + client + "\""};
    for (const std::string& p : params) lines.push_back(p);
    lines.push_back("outfile=\"" + tmp_.Sub("answer") + "\"");
    RsyncWrapper w;
    w.setKaroAuth(true, true);
    w.setTimeout(10);
    w.setKaroCustCmdRule(lines);
    w.setDestPath(kUser, "127.0.0.1", kPassword, "", "");
    return w.execute(boost::function<bool()>());
  }

  int Push() {
    RsyncWrapper w;
    w.setKaroAuth(true, true);
    w.setTimeout(10);
    w.setSrcPath(tmp_.Sub("src") + "/");
    w.setDestPath(kUser, "127.0.0.1", kPassword, "share1", "");
    return w.execute(boost::function<bool()>());
  }

  s2s_test::TempDir tmp_;
  s2s_test::ScopedEnv root_{"S2S_ROOT", tmp_.path()};
  s2s_test::RsyncDaemon daemon_{tmp_.path()};
  std::unique_ptr<s2s_test::ScopedEnv> port_;
};

TEST_F(ServerDaemonTest, SyncRunAndDataModuleGuard) {
  StartServer();
  EXPECT_EQ(0,
            Command("clientA", "S2S_PairingMultiSrc",
                    {"serverName=\"srv\"", "syncShares=\"share1\"",
                     "dryRun=\"no\"", "requireEncryptionShareSupport=\"no\""}));
  // No running sync yet: the data module refuses the push.
  EXPECT_NE(0, Push());
  EXPECT_EQ(
      0, Command("clientA", "S2S_SyncStart",
                 {"volumeName=\"vol1\"", "shareName=\"share1\"",
                  "isEncrypt=\"0\"", "isAutomount=\"0\"", "isEnableACL=\"1\"",
                  "isWinShare=\"0\"", "lenEncKey=\"0\""}));
  EXPECT_EQ(0, Push());
  EXPECT_EQ("payload", ReadFile(tmp_.Sub("share1/file")));
  // Only the client that holds the sync may finish it.
  EXPECT_EQ(kNotSyncing, Command("clientB", "S2S_SyncFinish",
                                 {"finishType=\"share\"", "name=\"share1\""}));
  EXPECT_EQ(0, Command("clientA", "S2S_SyncFinish",
                       {"finishType=\"share\"", "name=\"share1\""}));
  EXPECT_NE(0, Push());
  // Nothing is left in the spool once the connections are over.
  EXPECT_TRUE(std::filesystem::is_empty(tmp_.Sub("var/spool/s2s/reply")));
}

TEST_F(ServerDaemonTest, OversizedCommandIsRefusedWithStatus) {
  StartServer();
  std::string big(kMaxCommandFile, 'x');
  EXPECT_EQ(kMalformed, Command("c1", "S2S_UpdateTaskStatus",
                                {"taskName=\"" + big + "\""}));
  EXPECT_EQ(kBadId, Command("c1", "S2S_UpdateTaskStatus",
                            {"taskName=\"" + std::string(3000, 'x') + "\""}));
}

}  // namespace
