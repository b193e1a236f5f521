// The rsync wrapper's command channel against a real, scripted rsync daemon
// on loopback; data runs and failed connections are tested through Rsyncer.
#include "karo/rsync_wrapper.h"

#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>

#include "appliances.h"
#include "gtest/gtest.h"

namespace {

using KARO::Backup::RsyncWrapper;
using s2s_test::ReadFile;

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
    w_.setKaroAuth(true, true);
    w_.setTimeout(10);
    w_.setDestPath(kUser, "127.0.0.1", kPassword, "", "");
  }
  void TearDown() override { RsyncWrapper::setLogHandler(nullptr); }

  // Runs the command of `lines`; the wrapper's status.
  int Command(const std::list<std::string>& lines) {
    w_.setKaroCustCmdRule(lines);
    return w_.execute(boost::function<bool()>());
  }

  s2s_test::TempDir tmp_;
  s2s_test::ScopedEnv root_{"S2S_ROOT", tmp_.Sub("root")};
  s2s_test::ScriptedServer server_{tmp_.Sub("server")};
  const std::string out_ = tmp_.Sub("answer");
  RsyncWrapper w_;
};

TEST_F(RsyncWrapperTest, CommandReturnsServerStatusAndWritesAnswer) {
  server_.Answer("S2S_PairingMultiSrc", 214, "conflicts=\"docs\"\n");
  w_.setDebugLog(true);
  EXPECT_EQ(214, Command({"command=\"S2S_PairingMultiSrc\"", "dryRun=\"no\"",
                          "outfile=\"" + out_ + "\""}));
  EXPECT_EQ("conflicts=\"docs\"\n", ReadFile(out_));
  std::string request = server_.LastRequest("S2S_PairingMultiSrc");
  EXPECT_EQ(0u, request.find("command=\"S2S_PairingMultiSrc\"\ndryRun=\"no\"\n"
                             "outfile=\"" +
                             out_ + "\"\nrequestID=\""))
      << request;
  EXPECT_FALSE(s2s_test::Has(log_text, kPassword));

  // Too large to travel with the request: spooled in a connection of its own.
  std::string big(6000, 'x');
  EXPECT_EQ(
      0, Command({"command=\"S2S_SyncStart\"", "shareName=\"" + big + "\""}));
  EXPECT_TRUE(s2s_test::Has(server_.LastRequest("S2S_SyncStart"), big));
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

// A hostile 64 MiB reply: refused with its own status, and none of it kept.
TEST_F(RsyncWrapperTest, ReplyOverTheCapIsRefusedWithoutKeepingIt) {
  const std::list<std::string> version = {"command=\"S2S_GetProtocolVer\"",
                                          "outfile=\"" + out_ + "\""};
  server_.PadReply("S2S_GetProtocolVer", 64ull << 20);
  EXPECT_EQ(RsyncWrapper::kReplyTooLarge, Command(version));
  EXPECT_TRUE(s2s_test::Has(log_text, "reply larger than")) << log_text;
  EXPECT_FALSE(std::filesystem::exists(out_));
  EXPECT_TRUE(std::filesystem::is_empty(tmp_.Sub("root") + "/tmp/S2S"));
  // Within the cap, the same server is heard as usual.
  server_.PadReply("S2S_GetProtocolVer", 4096);
  EXPECT_EQ(0, Command(version));
  EXPECT_EQ(4096u - 9, std::filesystem::file_size(out_));
}

TEST_F(RsyncWrapperTest, PeerThatAcceptsAndStaysSilentTimesOut) {
  int silent = 0;
  int fd = s2s_test::LoopbackListener(&silent);  // nobody ever speaks
  ASSERT_GE(fd, 0);
  s2s_test::ScopedEnv port("S2S_RSYNC_PORT", std::to_string(silent));
  w_.setTimeout(1);
  auto start = std::chrono::steady_clock::now();
  EXPECT_NE(0, Command({"command=\"S2S_Pairing\""}));
  EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(5));
  close(fd);
}

}  // namespace
