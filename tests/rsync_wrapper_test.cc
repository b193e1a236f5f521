// The rsync wrapper against a real rsync daemon on loopback. The command
// module here is served by a small hook script that echoes the command back,
// so these tests pin the wrapper's side of the channel; the server's real
// handler has its own tests.
#include "karo/rsync_wrapper.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <mutex>
#include <thread>

#include "appliances.h"
#include "gtest/gtest.h"

namespace {

using KARO::Backup::RsyncWrapper;
using s2s_test::ReadFile;
using s2s_test::WriteFile;

const char kUser[] = "s2suser";
const char kPassword[] = "Pw-7f3a9c-secret";

std::mutex log_mutex;
std::string log_text;

void CaptureLog(int, const char* message) {
  std::lock_guard<std::mutex> lock(log_mutex);
  log_text += message;
  log_text += "\n";
}

class RsyncWrapperTest : public ::testing::Test {
 protected:
  void SetUp() override {
    RsyncWrapper::setLogHandler(&CaptureLog);
    log_text.clear();
    for (const char* d : {"data", "src", "root"}) {
      mkdir(tmp_.Sub(d).c_str(), 0700);
    }
    ASSERT_TRUE(server_.Start(
        kUser, kPassword, {{"share", tmp_.Sub("data"), {"read only = no"}}}))
        << server_.daemon().Log();
  }
  void TearDown() override { RsyncWrapper::setLogHandler(nullptr); }

  void Configure(RsyncWrapper& w, const std::string& module,
                 const std::string& password = kPassword) {
    w.setKaroAuth(true, true);
    w.setTimeout(10);
    w.setDestPath(kUser, "127.0.0.1", password, module, "");
  }

  s2s_test::TempDir tmp_;
  s2s_test::ScopedEnv root_{"S2S_ROOT", tmp_.Sub("root")};
  // The command modules, and a data module "share".
  s2s_test::ScriptedServer server_{tmp_.Sub("server")};
};

TEST_F(RsyncWrapperTest, CommandReturnsServerStatusAndWritesAnswer) {
  std::string out = tmp_.Sub("answer");
  server_.Answer("S2S_PairingMultiSrc", 214, "conflicts=\"docs\"\n");
  RsyncWrapper w;
  Configure(w, "");
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
  // Nothing of the exchange stays behind in the temporary directory.
  EXPECT_TRUE(std::filesystem::is_empty(tmp_.Sub("root") + "/tmp/S2S"));

  // Too large to travel with the request: spooled in a connection of its own.
  std::string big(6000, 'x');
  w.setKaroCustCmdRule(
      {"command=\"S2S_SyncStart\"", "shareName=\"" + big + "\""});
  EXPECT_EQ(0, w.execute(boost::function<bool()>()));
  EXPECT_NE(std::string::npos, server_.LastRequest("S2S_SyncStart").find(big));
}

TEST_F(RsyncWrapperTest, ConnectionFailuresReturnRsyncExitCodes) {
  RsyncWrapper wrong;
  Configure(wrong, "", "not-the-password");
  wrong.setKaroCustCmdRule({"command=\"S2S_Pairing\""});
  EXPECT_EQ(5, wrong.execute(boost::function<bool()>()));
  RsyncWrapper refused;
  Configure(refused, "");
  refused.setKaroCustCmdRule({"command=\"S2S_Pairing\""});
  s2s_test::ScopedEnv closed("S2S_RSYNC_PORT",
                             std::to_string(s2s_test::FreeLoopbackPort()));
  EXPECT_EQ(10, refused.execute(boost::function<bool()>()));
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

TEST_F(RsyncWrapperTest, PeerThatAcceptsAndStaysSilentTimesOut) {
  int silent = 0;
  int fd = s2s_test::LoopbackListener(&silent);  // nobody ever speaks
  ASSERT_GE(fd, 0);
  s2s_test::ScopedEnv port("S2S_RSYNC_PORT", std::to_string(silent));
  RsyncWrapper w;
  Configure(w, "");
  w.setTimeout(1);
  w.setKaroCustCmdRule({"command=\"S2S_Pairing\""});
  auto start = std::chrono::steady_clock::now();
  int status = w.execute(boost::function<bool()>());
  auto took = std::chrono::steady_clock::now() - start;
  close(fd);
  EXPECT_NE(0, status);
  EXPECT_LT(took, std::chrono::seconds(5));
}

TEST_F(RsyncWrapperTest, DataPushHonoursSwitches) {
  std::string src = tmp_.Sub("src");
  std::string data = tmp_.Sub("data");
  mkdir((src + "/dir").c_str(), 0755);
  WriteFile(src + "/dir/file", std::string(100000, 'a'));
  WriteFile(src + "/skip.tmp", "excluded");
  WriteFile(data + "/stale", "deleted by --delete");
  {
    RsyncWrapper w;
    Configure(w, "share");
    w.setDelete(true);
    w.setNumericIds(true);
    w.setCompress(true);
    w.setDeltaCopy(true);
    w.setExcludeRule({"*.tmp"});
    w.setSrcPath(src + "/");
    ASSERT_EQ(0, w.execute(boost::function<bool()>())) << log_text;
  }
  EXPECT_EQ(std::string(100000, 'a'), ReadFile(data + "/dir/file"));
  EXPECT_FALSE(std::filesystem::exists(data + "/stale"));
  EXPECT_FALSE(std::filesystem::exists(data + "/skip.tmp"));

  // A changed file below a marked sub-path lands at the same relative place.
  WriteFile(src + "/dir/file", std::string(100000, 'a') + "tail");
  RsyncWrapper rel;
  Configure(rel, "share");
  rel.setRelativePath(true);
  rel.setDeltaCopy(true);
  rel.setSrcPath(src + "/./dir/file");
  ASSERT_EQ(0, rel.execute(boost::function<bool()>())) << log_text;
  EXPECT_EQ(std::string(100000, 'a') + "tail", ReadFile(data + "/dir/file"));
}

// Lists the processes whose parent is this test.
std::vector<int> Children() {
  std::vector<int> pids;
  DIR* d = opendir("/proc");
  while (dirent* e = readdir(d)) {
    int pid = atoi(e->d_name);
    if (pid <= 0) continue;
    std::string stat = ReadFile("/proc/" + std::to_string(pid) + "/stat");
    size_t paren = stat.rfind(')');
    if (paren == std::string::npos) continue;
    if (atoi(stat.c_str() + paren + 4) == getpid()) pids.push_back(pid);
  }
  closedir(d);
  return pids;
}

bool HasTempFile(const std::string& dir) {
  for (const auto& e : std::filesystem::directory_iterator(dir)) {
    if (e.path().filename().string().rfind(".big.", 0) == 0) return true;
  }
  return false;
}

TEST_F(RsyncWrapperTest, CancelStopsLargeTransferAndPasswordStaysOffCmdline) {
  std::string big = tmp_.Sub("src") + "/big";
  int fd = open(big.c_str(), O_CREAT | O_WRONLY, 0600);
  ASSERT_EQ(0, ftruncate(fd, 4LL << 30));  // sparse: costs no disk here
  close(fd);
  std::string cmdline;
  std::string environ_text;
  std::chrono::steady_clock::time_point cancelled_at;
  bool cancel = false;
  auto checker = [&]() {
    if (cmdline.empty()) {
      for (int pid : Children()) {
        cmdline = ReadFile("/proc/" + std::to_string(pid) + "/cmdline");
        environ_text = ReadFile("/proc/" + std::to_string(pid) + "/environ");
      }
    }
    if (!cancel && HasTempFile(tmp_.Sub("data"))) {
      cancel = true;
      cancelled_at = std::chrono::steady_clock::now();
    }
    return cancel;
  };
  RsyncWrapper w;
  Configure(w, "share");
  w.setSrcPath(big);
  EXPECT_EQ(RsyncWrapper::kCancelled, w.execute(checker));
  EXPECT_TRUE(cancel);
  EXPECT_LT(std::chrono::steady_clock::now() - cancelled_at,
            std::chrono::milliseconds(1200));
  EXPECT_NE(std::string::npos, cmdline.find("rsync"));
  EXPECT_EQ(std::string::npos, cmdline.find(kPassword));
  EXPECT_NE(std::string::npos,
            environ_text.find(std::string("RSYNC_PASSWORD=") + kPassword));
  // The daemon's receiver removes its temporary file once the link drops.
  for (int i = 0; i < 300 && HasTempFile(tmp_.Sub("data")); ++i) {
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  EXPECT_FALSE(HasTempFile(tmp_.Sub("data")));
  EXPECT_FALSE(std::filesystem::exists(tmp_.Sub("data") + "/big"));
}

}  // namespace
