// The server end to end: a generated daemon configuration, the real rsync
// daemon on loopback running the real handler, and the client's wrapper.
#include <sys/socket.h>
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
// A second client with a daemon user of its own.
const char kOtherUser[] = "mallory";
const char kOtherPassword[] = "other-Secret-17";

class ServerDaemonTest : public ::testing::Test {
 protected:
  void StartServer() {
    ASSERT_TRUE(tmp_.MakeDir("/share1"));
    ASSERT_TRUE(
        tmp_.Write("/etc/s2s/shares.conf",
                   "[share1]\n\tpath=\"" + tmp_.Sub("share1") + "\"\n"));
    ASSERT_TRUE(tmp_.Write("/src/file", "payload"));
    DaemonConfig config;
    config.handler = S2S_CMD_HANDLER;
    config.user = kOtherUser;
    config.password = kOtherPassword;
    ASSERT_EQ(0, WriteDaemonConfig(config));
    // A second user joins the first.
    config.user = kUser;
    config.password = kPassword;
    ASSERT_EQ(0, WriteDaemonConfig(config));
    EXPECT_EQ(0600, s2s_test::Mode(DaemonSecretsPath()));
    ASSERT_TRUE(daemon_.StartWithConfig(DaemonConfigPath())) << daemon_.Log();
    port_.reset(new s2s_test::ScopedEnv("S2S_RSYNC_PORT",
                                        std::to_string(daemon_.port())));
  }

  // Runs one command for `client`; its status.
  int Command(const std::string& client, const std::string& command,
              std::vector<std::string> params, const char* user = kUser,
              const char* password = kPassword) {
    std::list<std::string> lines = {"command=\"" + command + "\"",
                                    "clientID=\"" + client + "\""};
    for (const std::string& p : params) lines.push_back(p);
    lines.push_back("outfile=\"" + tmp_.Sub("answer") + "\"");
    RsyncWrapper w;
    w.setKaroAuth(true, true);
    w.setTimeout(10);
    w.setKaroCustCmdRule(lines);
    w.setDestPath(user, "127.0.0.1", password, "", "");
    return w.execute(boost::function<bool()>());
  }

  // A command file for plain rsync's --early-input, under request id `id`.
  std::string EarlyInput(const std::string& id) {
    WriteFile(tmp_.Sub("cmd"),
              "command=\"S2S_GetProtocolVer\"\nclientID=\"c\"\nrequestID=\"" +
                  id + "\"\n");
    return "--early-input=" + tmp_.Sub("cmd");
  }

  // Plain rsync as `user`, as a hostile client would run it; its exit code.
  int Rsync(const std::vector<std::string>& args, const char* user = kUser,
            const char* password = kPassword) {
    const std::string url = "rsync://" + std::string(user) +
                            "@127.0.0.1:" + std::to_string(daemon_.port()) +
                            "/";
    std::vector<std::string> argv = {"rsync"};
    for (const std::string& a : args)  // all but files and options: modules
      argv.push_back(a[0] == '/' || a[0] == '-' ? a : url + a);
    return s2s_test::RunProgram(tmp_.path(), argv,
                                {"RSYNC_PASSWORD=" + std::string(password)})
        .code;
  }

  int Push() {
    RsyncWrapper w;
    w.setKaroAuth(true, true);
    w.setTimeout(10);
    w.setSrcPath(tmp_.Sub("src") + "/");
    w.setDestPath(kUser, "127.0.0.1", kPassword, "share1", "");
    return w.execute(boost::function<bool()>());
  }

  // A connection to `module` stopped at the password challenge, counted
  // against the module's limit; -1 when refused.
  int Stalled(const std::string& module) {
    int fd = s2s_test::ConnectLoopback(daemon_.port());
    std::string said, hello = "@RSYNCD: 31.0\n" + module + "\n";
    timeval bound = {10, 0};
    setsockopt(fd, SOL_SOCKET, SO_RCVTIMEO, &bound, sizeof bound);
    if (write(fd, hello.data(), hello.size()) ==
        static_cast<ssize_t>(hello.size())) {
      char buf[256];
      ssize_t n;
      while (!s2s_test::Has(said, "AUTHREQD") &&
             (n = read(fd, buf, sizeof buf)) > 0) {
        said.append(buf, static_cast<size_t>(n));
      }
    }
    if (s2s_test::Has(said, "AUTHREQD")) return fd;
    if (fd >= 0) close(fd);
    return -1;
  }

  s2s_test::TempRoot tmp_;
  s2s_test::RsyncDaemon daemon_{tmp_.path()};
  std::unique_ptr<s2s_test::ScopedEnv> port_;
};

// What a client that knows a daemon password tries while another syncs the
// share: each row must fail and leave the victim's files as they were.
TEST_F(ServerDaemonTest, SyncRunGuardedAgainstHostileClients) {
  StartServer();
  // A command too large to parse arrives through the spool and is refused.
  std::string big(kMaxCommandFile, 'x');
  EXPECT_EQ(kMalformed, Command("c1", "S2S_UpdateTaskStatus",
                                {"taskName=\"" + big + "\""}));
  EXPECT_EQ(kBadId, Command("c1", "S2S_UpdateTaskStatus",
                            {"taskName=\"" + std::string(3000, 'x') + "\""}));
  const std::vector<std::string> start = {"volumeName=\"vol1\"",
                                          "shareName=\"share1\""};
  const std::vector<std::string> finish = {"finishType=\"share\"",
                                           "name=\"share1\""};
  EXPECT_EQ(0,
            Command("CL1", "S2S_PairingMultiSrc",
                    {"serverName=\"srv\"", "syncShares=\"share1\"",
                     "dryRun=\"no\"", "requireEncryptionShareSupport=\"no\""}));
  // No running sync yet: the data module refuses the push.
  EXPECT_NE(0, Push());
  ASSERT_EQ(0, Command("CL1", "S2S_SyncStart", start));
  // Connections to other modules leave the share's own places free.
  std::vector<int> stalled;
  for (int i = 0; i < 4; ++i) stalled.push_back(Stalled("s2sspool"));
  EXPECT_EQ(0, Push());
  for (int fd : stalled) {
    EXPECT_GE(fd, 0);
    close(fd);
  }
  EXPECT_EQ("payload", ReadFile(tmp_.Sub("share1/file")));
  std::string upload = tmp_.Sub("var/spool/s2s/upload");
  ASSERT_TRUE(tmp_.MakeDir("/empty"));
  ASSERT_TRUE(tmp_.Write("/tree/sub/f", "x"));
  WriteFile(tmp_.Sub("key"), "victim key");
  WriteFile(tmp_.Sub("evil"), "evil key");
  WriteFile(tmp_.Sub("big"), std::string(kMaxCommandFile + 1, 'b'));
  // The client holding the sync pushes its key and a pending upload.
  ASSERT_EQ(0, Rsync({tmp_.Sub("key"), "s2skeys/share1"}));
  ASSERT_EQ(0, Rsync({tmp_.Sub("key"), "s2sspool/pending"}));
  EXPECT_EQ(0600, s2s_test::Mode(upload + "/pending"));

  std::string src = tmp_.Sub("empty") + "/";
  struct Row {
    const char* what;
    std::vector<std::string> args;
  } rows[] = {
      {"delete every key", {"-r", "--delete", src, "s2skeys/"}},
      {"replace a key", {tmp_.Sub("evil"), "s2skeys/share1"}},
      {"delete every upload", {"-r", "--delete", src, "s2sspool/"}},
      {"replace an upload", {tmp_.Sub("evil"), "s2sspool/pending"}},
      {"upload a tree", {"-r", tmp_.Sub("tree"), "s2sspool/t1"}},
      {"push into the share", {"-r", "--delete", src, "share1/"}},
      {"dry run into the share", {"-n", "-r", "--delete", src, "share1/"}},
  };
  for (const Row& row : rows)
    EXPECT_NE(0, Rsync(row.args, kOtherUser, kOtherPassword)) << row.what;
  EXPECT_EQ("victim key", ReadFile(tmp_.Sub("usr/karo/etc/.encrypt/share1")));
  EXPECT_EQ("victim key", ReadFile(upload + "/pending"));
  EXPECT_FALSE(std::filesystem::exists(upload + "/t1"));
  // Nor may it start a sync of share1 of its own, or finish CL1's.
  EXPECT_EQ(kPairedElsewhere,
            Command("CLM", "S2S_SyncStart", start, kOtherUser, kOtherPassword));
  EXPECT_EQ(kNotSyncing, Command("CLM", "S2S_SyncFinish", finish, kOtherUser,
                                 kOtherPassword));
  // An oversized upload does not stay: the next upload clears it.
  EXPECT_EQ(
      0, Rsync({tmp_.Sub("big"), "s2sspool/big"}, kOtherUser, kOtherPassword));
  EXPECT_EQ(0, Rsync({tmp_.Sub("evil"), "s2sspool/next"}, kOtherUser,
                     kOtherPassword));
  EXPECT_FALSE(std::filesystem::exists(upload + "/big"));
  // The early hook refuses a malformed request id at the connection's start.
  EXPECT_EQ(5, Rsync({EarlyInput("a..b"), "s2scmd/a..b", src}));
  // A user's pulls reach no other user's replies; its own command runs.
  const std::string replies = tmp_.Sub("var/spool/s2s/reply");
  const std::string victim = "/var/spool/s2s/reply/" + std::string(kUser);
  ASSERT_TRUE(tmp_.Write(victim + "/pending", "status=0\n"));
  EXPECT_NE(5, Rsync({EarlyInput("r1"), "s2scmd/*/pending", src}, kOtherUser,
                     kOtherPassword));
  EXPECT_TRUE(std::filesystem::is_empty(tmp_.Sub("empty")));
  std::filesystem::remove(tmp_.Path(victim + "/pending"));
  EXPECT_EQ(0, Command("CL1", "S2S_SyncFinish", finish));
  EXPECT_NE(0, Push());
  // The feeding client's dry run needs no running sync and changes nothing.
  EXPECT_EQ(0, Rsync({"-n", "-r", "--delete", src, "share1/"}));
  EXPECT_EQ("payload", ReadFile(tmp_.Sub("share1/file")));
  // Each command's cleaner empties the spool once its connection has ended.
  EXPECT_TRUE(s2s_test::WaitUntil(
      [&] {
        for (const auto& e :
             std::filesystem::recursive_directory_iterator(replies)) {
          if (!e.is_directory()) return false;
        }
        return true;
      },
      10));
}

}  // namespace
