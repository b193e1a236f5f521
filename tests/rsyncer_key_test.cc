// An encrypted share's key file travels to the server's key directory, always
// over SSH: a real sshd whose forced command serves the server's daemon.
#include <sys/stat.h>

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
namespace fs = std::filesystem;

class RsyncerKeyTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_TRUE(app_.AddShare("docs"));
    ASSERT_TRUE(app_.AddShare("vault", /*encrypted=*/true));
    ASSERT_TRUE(app_.AddShare("nokey", /*encrypted=*/true));
    ASSERT_TRUE(WriteFile(
        app_.server_root() + "/etc/s2s/shares.conf",
        ReadFile(app_.server_root() + "/etc/s2s/shares.conf") +
            "[auto]\n\tpath=\"" + app_.server_root() + "/data/auto\"\n"));
    ASSERT_TRUE(app_.StartServer()) << app_.DaemonLog();
    ASSERT_TRUE(StartSshd());
    // A share decrypted at start-up keeps its key elsewhere.
    std::string conf = ReadFile(app_.client_root() + "/etc/s2s/shares.conf") +
                       "[auto]\n\tpath=\"" + app_.client_root() +
                       "/data/auto\"\n\tvolume=\"/"
                       "volume1\"\n\tencrypted=\"yes\"\n\tauto_mount=\"yes\"\n"
                       "\tauto_key_file=\"" +
                       app_.client_root() + "/keys/auto.stored\"\n";
    ASSERT_TRUE(WriteFile(app_.client_root() + "/etc/s2s/shares.conf", conf));
    ASSERT_TRUE(WriteFile(app_.client_root() + "/keys/vault.key",
                          "vault key material"));
    ASSERT_TRUE(WriteFile(app_.client_root() + "/keys/auto.stored", "auto"));
    // The probe and the pairing use the daemon; SSH is off for the sync.
    S2S::SyncInfo info = app_.Info();
    info.SetSSHPort(ssh_port_);
    ASSERT_EQ(0, r_.Initialize(info));
  }
  void TearDown() override { s2s_test::StopChild(&sshd_); }

  // A real sshd that lets the client's generated key in to the daemon.
  bool StartSshd() {
    const std::string ssh = app_.client_root() + "/etc/s2s/ssh";
    const std::string host_key = ssh_dir_.Sub("host_key"),
                      authorized = ssh_dir_.Sub("authorized_keys"),
                      conf = ssh_dir_.Sub("sshd_config");
    fs::create_directories(ssh);
    auto keygen = [](const std::string& key) {
      return s2s_test::RunQuiet(
          {"ssh-keygen", "-q", "-t", "ed25519", "-N", "", "-f", key});
    };
    if (!keygen(host_key) || !keygen(ssh + "/id_ed25519") ||
        !WriteFile(authorized, "command=\"rsync --server --daemon --config=" +
                                   app_.server_root() +
                                   "/etc/s2s/rsyncd.conf .\",no-pty " +
                                   ReadFile(ssh + "/id_ed25519.pub")) ||
        !WriteFile(conf, "ListenAddress 127.0.0.1\nHostKey " + host_key +
                             "\nAuthorizedKeysFile " + authorized +
                             "\nStrictModes no\nPasswordAuthentication no\n"
                             "PidFile none\n")) {
      return false;
    }
    mkdir("/run/sshd", 0755);  // sshd insists on its privilege separation
    sshd_ = s2s_test::SpawnListening(
        [&](int port) -> std::vector<std::string> {
          return {"/usr/sbin/sshd",    "-D", "-e", "-f", conf, "-p",
                  std::to_string(port)};
        },
        ssh_dir_.Sub("sshd.log"), &ssh_port_);
    return sshd_ > 0 && WriteFile(ssh + "/known_hosts",
                                  "[127.0.0.1]:" + std::to_string(ssh_port_) +
                                      " " + ReadFile(host_key + ".pub"));
  }

  s2s_test::Appliances app_{S2S_CMD_HANDLER};
  const std::string keys_ = app_.server_root() + "/usr/karo/etc/.encrypt";
  s2s_test::TempDir ssh_dir_;
  pid_t sshd_ = -1;
  int ssh_port_ = -1;
  Rsyncer r_;
};

TEST_F(RsyncerKeyTest, KeyFilesTravelOverSshEvenWithSshOff) {
  ASSERT_FALSE(r_.GetSyncInfo().UseSSH());
  LogCapture log;
  // The key module takes a share's key only from the client syncing it.
  EXPECT_NE(0, r_.SyncEncryptKey("vault"));
  EXPECT_FALSE(fs::exists(keys_ + "/vault"));
  // Shares the platform does not know are 300.
  EXPECT_EQ(300, r_.SyncEncryptKey("nope"));
  EXPECT_TRUE(Has(log.Text(), "Fail to get share 'nope', errno=[8704]\n"));
  EXPECT_EQ(300, r_.SyncEncryptKey("bad/name"));
  EXPECT_TRUE(Has(log.Text(), "Fail to get share 'bad/name', errno=[3328]\n"));
  for (const char* share : {"vault", "auto"}) {
    int status = -1;
    ASSERT_EQ(0, r_.StartSyncShare(share, status));
    ASSERT_EQ(0, status) << share;
  }
  EXPECT_EQ(0, r_.SyncEncryptKey("vault"));
  // Key contents never reach the log.
  EXPECT_FALSE(Has(log.Text(), "key material"));
  EXPECT_EQ("vault key material", ReadFile(keys_ + "/vault"));
  EXPECT_EQ(0, r_.SyncEncryptKey("auto"));
  EXPECT_EQ("auto", ReadFile(keys_ + "/auto"));

  // Nothing to send: an unencrypted share, an encrypted one without a key.
  for (const std::string share : {"docs", "nokey"}) {
    EXPECT_EQ(0, r_.SyncEncryptKey(share));
    EXPECT_FALSE(fs::exists(keys_ + "/" + share)) << share;
  }
  // An unknown server key fails the copy at once instead of prompting.
  std::string known = app_.client_root() + "/etc/s2s/ssh/known_hosts";
  std::string hosts = ReadFile(known);
  ASSERT_TRUE(WriteFile(known, ""));
  auto start = std::chrono::steady_clock::now();
  EXPECT_NE(0, r_.SyncEncryptKey("vault"));
  EXPECT_LT(std::chrono::steady_clock::now() - start, std::chrono::seconds(5));
  ASSERT_TRUE(WriteFile(known, hosts));
  // The daemon's own port would not do: without sshd the copy fails.
  s2s_test::StopChild(&sshd_);
  EXPECT_NE(0, r_.SyncEncryptKey("vault"));
}

}  // namespace
