// The server's pairing registry: records, pairing modes, status, writers.
#include "S2S/is_syncedshare.h"

#include <gtest/gtest.h>
#include <time.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "karo_err.h"
#include "testutil.h"

namespace {

using s2s_test::Has;
using s2s_test::MakeHash;
using s2s_test::ReadFile;
const auto Value = s2s_test::RegistryValue;

std::string Joined(const KSZLIST* l) {
  std::string out;
  for (int i = 0; i < KLIBCSzListCount(l); ++i)
    out += std::string(i ? ":" : "") + KLIBCSzListGet(l, i);
  return out;
}

class RegistryTest : public ::testing::Test {
 protected:
  std::string File() const { return root_.Path("/usr/karo/etc/karoS2S.info"); }
  void Write(const std::string& text) {
    ASSERT_EQ(S2SCheckServerInfo(), 0);
    ASSERT_TRUE(s2s_test::WriteFile(File(), text));
  }

  s2s_test::TempRoot root_;
  s2s_test::SyslogCapture syslog_;
};

TEST_F(RegistryTest, IsSyncedShareFollowsRunningIdAndTheSwitch) {
  EXPECT_EQ(KAROS2SIsSyncedShare("docs"), 0);  // no registry file at all
  EXPECT_EQ(KAROS2SIsSyncedShare(""), 0);
  EXPECT_EQ(KLIBCErrGet(), KERR_INVALID_ARG);
  Write("[SHARE_docs]\n\tRunningID=\"c1\"\n[SHARE_idle]\n\tRunningID=\"\"\n");
  EXPECT_EQ(KAROS2SIsSyncedShare("docs"), 1);
  EXPECT_EQ(KAROS2SIsSyncedShare("idle"), 0);
  ASSERT_EQ(KAROUISetS2S(0, nullptr, nullptr), 0);
  EXPECT_EQ(KAROS2SIsSyncedShare("docs"), 0);
  ASSERT_EQ(KAROUISetS2S(1, nullptr, nullptr), 0);
  EXPECT_EQ(KAROS2SIsSyncedShare("docs"), 1);
  EXPECT_EQ(syslog_.Text(), "");

  Write("[SHARE_docs]\n\tRunningID=\"" + std::string(300, 'x') + "\"\n");
  EXPECT_EQ(KAROS2SIsSyncedShare("docs"), 0);
  s2s_test::ExpectHas(syslog_.Text(), {"is_syncedshare:",
                                       "KLIBCFileGetSectionValue error. "
                                       "key:[SHARE_docs] errno=[0x2400]"});
}

TEST_F(RegistryTest, RecordsAreReplacedWholeAndNamesFromTheNetworkChecked) {
  auto a = MakeHash({{"k1", "1"}, {"RunningID", "c1"}});
  auto b = MakeHash({{"k2", "two"}});
  ASSERT_EQ(S2SUpdateServerInfo("A", a.get()), 0);
  ASSERT_EQ(S2SUpdateServerInfo("A", b.get()), 0);
  EXPECT_EQ(Value("A", "k1"), "");
  EXPECT_EQ(Value("A", "k2"), "two");
  ASSERT_EQ(S2SServerUpdateShare("docs", a.get()), 0);
  ASSERT_EQ(S2SServerUpdateTask("t1", a.get()), 0);
  char buf[16];
  EXPECT_EQ(S2SServerGetShare("docs", "RunningID", buf, sizeof buf), 2);
  EXPECT_STREQ(buf, "c1");
  EXPECT_EQ(Value("TASK_t1", "RunningID"), "c1");
  EXPECT_EQ(S2SServerGetShare("docs", "CompleteID", buf, sizeof buf), -1);
  EXPECT_EQ(KLIBCErrGet(), KERR_NOT_FOUND);
  EXPECT_EQ(S2SServerGetShare(nullptr, "RunningID", buf, sizeof buf), -1);

  // Names a section cannot hold are refused whole, and said so once.
  const std::string before = ReadFile(File());
  syslog_.Clear();
  EXPECT_EQ(S2SUpdateServerInfo("C]", a.get()), -1);
  EXPECT_EQ(S2SUpdateServerInfo(nullptr, a.get()), -1);
  EXPECT_EQ(S2SServerUpdateShare("x]\n[PairedClientInfo", a.get()), -1);
  EXPECT_EQ(ReadFile(File()), before);
  EXPECT_EQ(syslog_.Messages()[1],
            "Set section [C] ] value into [" + File() + "] error.");
  // A registry that does not parse is not overwritten.
  Write("[A]\nno equals sign\n");
  EXPECT_EQ(S2SUpdateServerInfo("A", b.get()), -1);
  EXPECT_EQ(ReadFile(File()), "[A]\nno equals sign\n");
}

TEST_F(RegistryTest, PairingMovesToManyClientModeAndResetRemembersTheClient) {
  EXPECT_EQ(S2SServerIfOldClientPaired(), 0);  // nothing paired yet
  ASSERT_EQ(KAROUISetS2S(1, "c1", "srv1"), 0);
  EXPECT_EQ(S2SServerIfOldClientPaired(), 1);
  // The switch alone, or an id without a name, keeps the paired client.
  ASSERT_EQ(KAROUISetS2S(0, "c2", nullptr), 0);
  EXPECT_EQ(Value("PairedClientInfo", "s2sEnabled"), "no");
  ASSERT_EQ(KAROUISetS2S(1, nullptr, nullptr), 0);
  EXPECT_EQ(Value("PairedClientInfo", "clientID"), "c1");
  EXPECT_EQ(KAROUISetS2S(1, "bad\nid", "srv"), -1);
  EXPECT_EQ(S2SServerUpdatePairInfo("c1", ""), S2S_SVR_BAD_ARGUMENT);
  EXPECT_EQ(S2SServerUpdatePairInfo("c1]", "srv1"), S2S_SVR_WRITE_ERROR);
  EXPECT_EQ(Value("CLIENTID_c1", "ServerName"), "");
  EXPECT_EQ(S2SServerUpdatePairInfo("c1", "srv1"), S2S_SVR_OK);
  EXPECT_EQ(Value("CLIENTID_c1", "ServerName"), "srv1");
  EXPECT_EQ(Value("PairedClientInfo", "clientID"), S2S_MULTI_SRC_MARKER);
  EXPECT_EQ(Value("PairedClientInfo", "s2sEnabled"), "yes");
  EXPECT_EQ(S2SServerIfOldClientPaired(), 0);

  auto owned = MakeHash({{"clientID", S2S_MULTI_SRC_MARKER}});
  KSZHASH* half = owned.get();
  EXPECT_EQ(S2SServerSetPairValue(nullptr), S2S_SVR_BAD_ARGUMENT);
  EXPECT_EQ(S2SServerSetPairValue(half), S2S_SVR_VALUE_ERROR);
  KLIBCSzHashSetValue(half, "serverName", "srv9");
  EXPECT_EQ(S2SServerSetPairValue(half), S2S_SVR_OK);
  EXPECT_EQ(S2SServerIfOldClientPaired(), 1);  // marker id, real name
  KLIBCSzHashSetValue(half, "serverName", "two\nlines");
  EXPECT_EQ(S2SServerSetPairValue(half), S2S_SVR_WRITE_ERROR);

  ASSERT_EQ(KAROUISetS2S(1, "c2", "srv2"), 0);
  ASSERT_EQ(s2s_svr_reset_pair(), 0);
  EXPECT_EQ(Value("CLIENTID_c2", "ServerName"), "srv2");
  EXPECT_EQ(Value("PairedClientInfo", "serverName"), S2S_MULTI_SRC_MARKER);
  Write("");
  syslog_.Clear();
  ASSERT_EQ(s2s_svr_reset_pair(), 0);
  EXPECT_EQ(syslog_.Text(), "Failed to get clientID from hash.");
  EXPECT_EQ(Value("PairedClientInfo", "clientID"), S2S_MULTI_SRC_MARKER);
  Write("garbage\n");
  EXPECT_EQ(S2SServerIfOldClientPaired(), -1);
  EXPECT_TRUE(Has(syslog_.Text(), "Get server paired-info error."));
}

TEST_F(RegistryTest, CheckIfSharePairedSortsByFeeder) {
  Write(
      "[SHARE_free]\n[SHARE_mine]\n\tCompleteID=\"me\"\n"
      "[SHARE_running]\n\tCompleteID=\"me\"\n\tRunningID=\"other\"\n"
      "[SHARE_done]\n\tCompleteID=\"other\"\n"
      "[SHARE_back]\n\tCompleteID=\"other\"\n\tRunningID=\"me\"\n");
  KSZLIST* shares = KLIBCSzListAlloc();
  for (const char* s : {"free", "mine", "running", "done", "back", "new"})
    KLIBCSzListPush(shares, s);
  KSZLIST* l[3] = {KLIBCSzListAlloc(), KLIBCSzListAlloc(), KLIBCSzListAlloc()};
  ASSERT_EQ(S2SCheckIfSharePaired(shares, "me", l[0], l[1], l[2]), S2S_SVR_OK);
  EXPECT_EQ(Joined(l[0]), "free:new");
  EXPECT_EQ(Joined(l[1]), "mine:back");
  EXPECT_EQ(Joined(l[2]), "running:done");
  EXPECT_EQ(S2SCheckIfSharePaired(shares, "", l[0], l[1], l[2]),
            S2S_SVR_BAD_ARGUMENT);
  KLIBCSzListPush(shares, "");
  EXPECT_EQ(S2SCheckIfSharePaired(shares, "me", l[0], l[1], l[2]),
            S2S_SVR_BAD_ARGUMENT);
  Write("[SHARE_free]\n\tCompleteID=\"" + std::string(300, 'x') + "\"\n");
  EXPECT_EQ(S2SCheckIfSharePaired(shares, "me", l[0], l[1], l[2]),
            S2S_SVR_READ_ERROR);
  EXPECT_TRUE(Has(syslog_.Text(),
                  "Failed to get section [SHARE_free] CompleteID value."));
  for (KSZLIST* list : l) KLIBCSzListFree(list);
  KLIBCSzListFree(shares);
}

// The busy flag for `task` last active `age` s ago; retried if the clock ticks.
int BusyAtAge(const char* task, long age) {
  for (;;) {
    time_t before = time(nullptr);
    auto h = MakeHash({{"status", std::to_string(before - age).c_str()}});
    EXPECT_EQ(S2SServerUpdateTask(task, h.get()), 0);
    S2S_SVR_STATUS st;
    EXPECT_EQ(s2s_svr_get_status(&st), 0);
    s2s_svr_put_status(&st);
    if (time(nullptr) == before) return st.busy;
  }
}

// The service status as "running busy client server"; "-" for no string.
std::string Status() {
  S2S_SVR_STATUS st;
  if (s2s_svr_get_status(&st) != 0) return "failed";
  std::string out = std::to_string(st.running) + " " + std::to_string(st.busy) +
                    " " + (st.clientID ? st.clientID : "-") + " " +
                    (st.serverName ? st.serverName : "-");
  EXPECT_EQ(s2s_svr_put_status(&st), 0);
  EXPECT_EQ(st.clientID, nullptr);
  return out;
}

TEST_F(RegistryTest, StatusIsBusyForTwoMinutesAndRunsWithSwitchAndDaemon) {
  EXPECT_EQ(Status(), "0 0 - -");  // no client: null strings
  EXPECT_EQ(BusyAtAge("t1", 119), 1);
  EXPECT_EQ(BusyAtAge("t1", 120), 0);
  EXPECT_EQ(BusyAtAge("t2", 0), 1);  // any task counts
  ASSERT_EQ(KAROUISetS2S(1, "c1", "srv1"), 0);
  EXPECT_EQ(Status(), "0 1 c1 srv1");  // no daemon
  // This test process stands in for a live daemon.
  ASSERT_TRUE(root_.Write("/var/run/rsyncd.pid", std::to_string(getpid())));
  EXPECT_EQ(Status(), "1 1 c1 srv1");
  ASSERT_EQ(KAROUISetS2S(0, nullptr, nullptr), 0);
  EXPECT_EQ(Status(), "0 1 c1 srv1");
  EXPECT_EQ(s2s_svr_get_status(nullptr), 0);
  EXPECT_EQ(s2s_svr_put_status(nullptr), 0);
}

// Writers in several processes race to create the lock and the file.
TEST_F(RegistryTest, WritersInManyProcessesLoseNothing) {
  const int kWriters = 6, kRounds = 40;
  std::vector<int> codes = s2s_test::RunInChildren(kWriters, [](int who) {
    for (int i = 1; i <= kRounds; ++i) {
      std::string n = std::to_string(i), name = std::to_string(who);
      auto h = MakeHash({{"clientID", ("c" + n).c_str()},
                         {"serverName", ("srv" + n).c_str()},
                         {"round", n.c_str()}});
      int r = who == 0   ? KAROUISetS2S(i % 2, nullptr, nullptr)
              : who == 1 ? S2SServerSetPairValue(h.get())
              : who % 2  ? S2SServerUpdateTask(name.c_str(), h.get())
                         : S2SServerUpdateShare(name.c_str(), h.get());
      if (r != 0) return 1;
    }
    return 0;
  });
  EXPECT_EQ(std::vector<int>(kWriters, 0), codes);
  const std::string last = std::to_string(kRounds);
  EXPECT_EQ(Value("PairedClientInfo", "s2sEnabled"),
            kRounds % 2 ? "yes" : "no");
  EXPECT_EQ(Value("PairedClientInfo", "clientID"), "c" + last);
  EXPECT_EQ(Value("PairedClientInfo", "serverName"), "srv" + last);
  for (int who = 2; who < kWriters; ++who) {
    std::string section = (who % 2 ? "TASK_" : "SHARE_") + std::to_string(who);
    EXPECT_EQ(Value(section.c_str(), "round"), last) << section;
  }
}

}  // namespace
