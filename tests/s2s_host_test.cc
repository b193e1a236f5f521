#include "S2S/s2s_host.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include "karo_err.h"
#include "karo_net.h"
#include "karo_process.h"
#include "karo_service.h"
#include "testutil.h"

namespace {

using s2s_test::Has;
using s2s_test::SyslogCapture;

class HostTest : public ::testing::Test {
 protected:
  void TearDown() override { KLIBServicePause("s2s_daemon"); }
  bool Platform(const std::string& pairs) {
    return root_.Write("/etc/s2s/platform.conf", "[Platform]\n" + pairs);
  }
  s2s_test::TempRoot root_;
};

TEST_F(HostTest, HostNameFromThePlatformOrTheSystemCutToMaxlen) {
  char sys[256] = {0};
  ASSERT_EQ(gethostname(sys, sizeof sys - 1), 0);
  EXPECT_EQ(S2S::GetHostName(63), std::string(sys).substr(0, 63));
  ASSERT_TRUE(Platform("\thostname=\"storage01\"\n"));
  EXPECT_EQ(S2S::GetHostName(5), "stora");
  EXPECT_EQ(S2S::GetHostName(63), "storage01");
}

TEST_F(HostTest, ClientIdIsTheSerialElseAMacAddress) {
  const struct {
    const char *conf, *id;
  } cases[] = {
      {"\tserial=\"SN-0001\"\n\tha_mac=\"unused\"\n", "SN-0001"},
      {"\tha=\"yes\"\n\tserial=\"HA-SN\"\n", "HA-SN"},
      {"\tha=\"yes\"\n\tserial=\"\"\n\tha_mac=\"00:11:32:aa:bb:cc\"\n",
       "00:11:32:aa:bb:cc"},
      {"\tha=\"yes\"\n\tserial=\"\"\n", ""},
  };
  SyslogCapture log;
  for (const auto& c : cases) {
    ASSERT_TRUE(Platform(c.conf));
    EXPECT_EQ(S2S::GetClientID(), c.id) << c.conf;
  }
  EXPECT_TRUE(Has(log.Text(), "Fail to get ha sn and mac\n"));

  // A single appliance without a serial: the first NIC's MAC, lower case.
  ASSERT_TRUE(Platform("\tserial=\"\"\n"));
  KARO_NETIF nic[1];
  char mac[18] = "";
  if (KLIBNetGetInterfaceInfo(nic, 1, KARO_NETIF_SKIP_LOOPBACK) == 1) {
    const unsigned char* m = nic[0].mac;
    snprintf(mac, sizeof mac, "%02x:%02x:%02x:%02x:%02x:%02x", m[0], m[1], m[2],
             m[3], m[4], m[5]);
  }
  EXPECT_EQ(S2S::GetClientID(), mac);
}

TEST_F(HostTest, TempFilesLiveUnderTheRoot) {
  EXPECT_EQ(S2S::GetTempFile(), "");  // the directory is not created
  ASSERT_TRUE(root_.MakeDir("/tmp/S2S"));
  std::string a = S2S::GetTempFile(), b = S2S::GetTempFile();
  EXPECT_NE(a, b);
  EXPECT_EQ(a.rfind(root_.Path("/tmp/S2S/temp."), 0), 0u);
  EXPECT_TRUE(S2S::IsPathExist(a) && S2S::IsPathExist(b));
  S2S::PutTempFile(a);
  EXPECT_FALSE(S2S::IsPathExist(a));
  SyslogCapture log;
  S2S::PutTempFile("");
  EXPECT_EQ(log.Text(), "");
  S2S::PutTempFile(a);
  EXPECT_TRUE(Has(log.Text(), "Fail to unlink temp file '" + a + "' [2]"));
  S2S::PutTempFile(b);
}

TEST_F(HostTest, DaemonStartsWithoutTheStartersDescriptorsAndStops) {
  const std::string prog = root_.Sub("fake-client");
  ASSERT_TRUE(s2s_test::WriteScript(prog, "exec sleep 60\n"));
  ASSERT_TRUE(Platform("\tdaemon_program=\"" + prog + "\"\n"));
  EXPECT_FALSE(S2S::IsDaemonRunning());
  int inheritable = open("/dev/null", O_RDONLY);  // no O_CLOEXEC
  ASSERT_EQ(S2S::StartDaemon(), 0);
  EXPECT_TRUE(S2S::IsDaemonRunning());
  pid_t pid = KaroReadPidFile(root_.Path("/var/run/s2s_daemon.pid").c_str());
  ASSERT_GT(pid, 0);
  std::string fd_link =
      "/proc/" + std::to_string(pid) + "/fd/" + std::to_string(inheritable);
  EXPECT_NE(access(fd_link.c_str(), F_OK), 0);
  close(inheritable);
  // A second start meets the running service: 0xEB00, which is success.
  EXPECT_EQ(KLIBServiceStart("s2s_daemon", 0), -1);
  EXPECT_EQ(KLIBCErrGet(), 0xEB00);
  EXPECT_EQ(S2S::StartDaemon(), 0);

  ASSERT_EQ(S2S::StopDaemon(), 0);
  EXPECT_FALSE(S2S::IsDaemonRunning());
  // Gone, or a zombie until its new parent reaps it.
  const std::string probe = root_.Sub("probe.pid");
  ASSERT_TRUE(s2s_test::WriteFile(probe, std::to_string(pid)));
  EXPECT_EQ(KLIBCProcAliveByPidFile(probe.c_str()), 0);
  EXPECT_EQ(S2S::StopDaemon(), 0);  // stopping a stopped service is fine

  ASSERT_TRUE(Platform("\tdaemon_program=\"" + root_.Sub("none") + "\"\n"));
  SyslogCapture log;
  EXPECT_EQ(S2S::StartDaemon(), -1);
  EXPECT_TRUE(Has(log.Text(), "Fail to start daemon, karoerr=[0xEC00]\n"));
  EXPECT_EQ(KLIBServiceStart("other", 0), -1);
  EXPECT_EQ(KLIBCErrGet(), KERR_NOT_FOUND);
}

}  // namespace
