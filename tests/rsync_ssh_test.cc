// The wrapper's SSH transport against a real sshd on loopback: key-based,
// never prompting, rsync's daemon features through the forced command.
#include <pwd.h>
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>

#include "gtest/gtest.h"
#include "karo/rsync_wrapper.h"
#include "testutil.h"

namespace {

using KARO::Backup::RsyncWrapper;
using s2s_test::ReadFile;
using s2s_test::WriteFile;

std::string log_text;
void CaptureLog(int, const char* message) {
  log_text += std::string(message) + "\n";
}

class RsyncSshTest : public ::testing::Test {
 protected:
  void SetUp() override {
    mkdir(tmp_.Sub("keys").c_str(), 0700);
    mkdir(tmp_.Sub("src").c_str(), 0700);
    std::string conf = tmp_.Sub("rsyncd.conf");
    // The encrypted shares' key-file module, as the server exports it.
    WriteFile(conf, "use chroot = no\nuid = " + std::to_string(geteuid()) +
                        "\ngid = " + std::to_string(getegid()) +
                        "\n[s2skeys]\n\tpath = " + tmp_.Sub("keys") +
                        "\n\tread only = no\n");
    std::string ssh_dir = tmp_.Sub("root") + "/etc/s2s/ssh";
    ASSERT_TRUE(sshd_.Start("rsync --server --daemon --config=" + conf + " .",
                            ssh_dir + "/id_ed25519", ssh_dir + "/known_hosts"));
    user_ = getpwuid(geteuid())->pw_name;
    log_text.clear();
    RsyncWrapper::setLogHandler(&CaptureLog);
  }
  void TearDown() override { RsyncWrapper::setLogHandler(nullptr); }

  s2s_test::TempDir tmp_;
  s2s_test::ScopedEnv root_{"S2S_ROOT", tmp_.Sub("root")};
  s2s_test::SshServer sshd_{tmp_.path()};
  std::string user_;
};

// The key file reaches the key module; with the server's key unknown the
// same copy fails at once instead of prompting.
TEST_F(RsyncSshTest, KeyFileTravelsOnlyToAKnownHost) {
  std::string key = tmp_.Sub("src") + "/share.key";
  WriteFile(key, "key material");
  RsyncWrapper w;
  w.setSsh(true);
  w.setPort(sshd_.port());
  w.setTimeout(5);
  w.setSrcPath(key);
  w.setDestPath(user_, "127.0.0.1", "", "/usr/karo/etc/.encrypt", "share1");
  ASSERT_EQ(0, w.execute(boost::function<bool()>())) << log_text;
  EXPECT_EQ("key material", ReadFile(tmp_.Sub("keys") + "/share1"));

  WriteFile(tmp_.Sub("root") + "/etc/s2s/ssh/known_hosts", "");
  WriteFile(key, "other material");
  auto start = std::chrono::steady_clock::now();
  EXPECT_NE(0, w.execute(boost::function<bool()>()));
  EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(5));
  EXPECT_EQ("key material", ReadFile(tmp_.Sub("keys") + "/share1"));
}

}  // namespace
