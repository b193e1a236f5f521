// The rsync wrapper's command channel against a real rsync daemon on loopback
// whose command module answers what the test chose, so these tests pin the
// wrapper's side; data runs and the exit codes of failed connections are
// tested through the Rsyncer.
#include "karo/rsync_wrapper.h"

#include <poll.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>

#include "appliances.h"
#include "gtest/gtest.h"

namespace {

using KARO::Backup::RsyncWrapper;
using s2s_test::ReadFile;
using s2s_test::WriteFile;

const char kUser[] = "s2suser";
const char kPassword[] = "Pw-7f3a9c-secret";

// The wrapper logs on the thread that runs execute(): the test's.
std::string log_text;

void CaptureLog(int, const char* message) {
  log_text += message;
  log_text += "\n";
}

class RsyncWrapperTest : public ::testing::Test {
 protected:
  void SetUp() override {
    RsyncWrapper::setLogHandler(&CaptureLog);
    log_text.clear();
    mkdir(tmp_.Sub("root").c_str(), 0700);
    ASSERT_TRUE(server_.Start(kUser, kPassword)) << server_.daemon().Log();
  }
  void TearDown() override { RsyncWrapper::setLogHandler(nullptr); }

  void Configure(RsyncWrapper& w, const std::string& password = kPassword) {
    w.setKaroAuth(true, true);
    w.setTimeout(10);
    w.setDestPath(kUser, "127.0.0.1", password, "", "");
  }

  s2s_test::TempDir tmp_;
  s2s_test::ScopedEnv root_{"S2S_ROOT", tmp_.Sub("root")};
  s2s_test::ScriptedServer server_{tmp_.Sub("server")};
};

TEST_F(RsyncWrapperTest, CommandReturnsServerStatusAndWritesAnswer) {
  std::string out = tmp_.Sub("answer");
  server_.Answer("S2S_PairingMultiSrc", 214, "conflicts=\"docs\"\n");
  RsyncWrapper w;
  Configure(w);
  w.setDebugLog(true);
  w.setKaroCustCmdRule({"command=\"S2S_PairingMultiSrc\"", "dryRun=\"no\"",
                        "outfile=\"" + out + "\""});
  EXPECT_EQ(214, w.execute(boost::function<bool()>()));
  EXPECT_EQ("conflicts=\"docs\"\n", ReadFile(out));
  std::string request = server_.LastRequest("S2S_PairingMultiSrc");
  EXPECT_EQ(0u, request.find("command=\"S2S_PairingMultiSrc\"\ndryRun=\"no\"\n"
                             "outfile=\"" +
                             out + "\"\nrequestID=\""))
      << request;
  EXPECT_EQ(std::string::npos, log_text.find(kPassword));

  // Too large to travel with the request: spooled in a connection of its own.
  std::string big(6000, 'x');
  w.setKaroCustCmdRule(
      {"command=\"S2S_SyncStart\"", "shareName=\"" + big + "\""});
  EXPECT_EQ(0, w.execute(boost::function<bool()>()));
  EXPECT_NE(std::string::npos, server_.LastRequest("S2S_SyncStart").find(big));
}

TEST_F(RsyncWrapperTest, IncompleteSettingsAreRefusedWithoutRunningRsync) {
  RsyncWrapper no_host;
  EXPECT_EQ(RsyncWrapper::kBadSettings,
            no_host.execute(boost::function<bool()>()));
  RsyncWrapper no_password;
  no_password.setKaroAuth(true, true);
  no_password.setDestPath(kUser, "127.0.0.1", "", "share", "");
  no_password.setSrcPath(tmp_.Sub("src") + "/");
  EXPECT_EQ(RsyncWrapper::kBadSettings,
            no_password.execute(boost::function<bool()>()));
}

// A hostile server answering the version query with 64 MiB: refused with
// its own status, and nothing of it comes to the client's disk.
TEST_F(RsyncWrapperTest, ReplyOverTheCapIsRefusedWithoutKeepingIt) {
  std::string out = tmp_.Sub("answer");
  server_.PadReply("S2S_GetProtocolVer", 64ull << 20);
  RsyncWrapper w;
  Configure(w);
  w.setKaroCustCmdRule(
      {"command=\"S2S_GetProtocolVer\"", "outfile=\"" + out + "\""});
  EXPECT_EQ(RsyncWrapper::kReplyTooLarge, w.execute(boost::function<bool()>()));
  EXPECT_TRUE(s2s_test::Has(log_text, "reply larger than")) << log_text;
  EXPECT_FALSE(std::filesystem::exists(out));
  EXPECT_TRUE(std::filesystem::is_empty(tmp_.Sub("root") + "/tmp/S2S"));
  // Within the cap, the same server is heard as usual.
  server_.PadReply("S2S_GetProtocolVer", 4096);
  EXPECT_EQ(0, w.execute(boost::function<bool()>()));
  EXPECT_EQ(4096u - 9, std::filesystem::file_size(out));
}

TEST_F(RsyncWrapperTest, PeerThatAcceptsAndStaysSilentTimesOut) {
  int silent = 0;
  int fd = s2s_test::LoopbackListener(&silent);  // nobody ever speaks
  ASSERT_GE(fd, 0);
  s2s_test::ScopedEnv port("S2S_RSYNC_PORT", std::to_string(silent));
  RsyncWrapper w;
  Configure(w);
  w.setTimeout(1);
  w.setKaroCustCmdRule({"command=\"S2S_Pairing\""});
  auto start = std::chrono::steady_clock::now();
  int status = w.execute(boost::function<bool()>());
  auto took = std::chrono::steady_clock::now() - start;
  close(fd);
  EXPECT_NE(0, status);
  EXPECT_LT(took, std::chrono::seconds(5));
}

// A client killed while its rsync waits on a server never leaves that rsync
// behind: it ends with the client, not at its own timeout a minute later.
TEST_F(RsyncWrapperTest, RsyncEndsWithItsKilledClient) {
  int port = 0;
  int fd = s2s_test::LoopbackListener(&port);
  ASSERT_GE(fd, 0);
  s2s_test::ScopedEnv env("S2S_RSYNC_PORT", std::to_string(port));
  pid_t client = fork();
  if (client == 0) {
    RsyncWrapper w;
    Configure(w);
    w.setTimeout(60);
    w.setKaroCustCmdRule({"command=\"S2S_Pairing\""});
    _exit(w.execute(boost::function<bool()>()));
  }
  ASSERT_GT(client, 0);
  // Once rsync has connected it runs; it is the client's only child.
  struct pollfd listening = {fd, POLLIN, 0};
  int conn =
      poll(&listening, 1, 10000) == 1 ? accept(fd, nullptr, nullptr) : -1;
  const std::string id = std::to_string(client);
  pid_t rsync = static_cast<pid_t>(
      atol(ReadFile("/proc/" + id + "/task/" + id + "/children").c_str()));
  kill(client, SIGKILL);
  waitpid(client, nullptr, 0);
  ASSERT_GE(conn, 0);
  ASSERT_GT(rsync, 0);
  int pidfd = static_cast<int>(syscall(SYS_pidfd_open, rsync, 0));
  struct pollfd ended = {pidfd, POLLIN, 0};
  bool gone = pidfd < 0 || poll(&ended, 1, 10000) == 1;
  if (!gone) kill(rsync, SIGKILL);
  EXPECT_TRUE(gone);
  if (pidfd >= 0) close(pidfd);
  close(conn);
  close(fd);
}

}  // namespace
