#include "S2S/is_syncedshare.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>

#include "karo_err.h"
#include "testutil.h"

namespace {

using s2s_test::ReadFile;
using s2s_test::SyslogCapture;
using s2s_test::TempRoot;
using s2s_test::WriteFile;

const char kRegistry[] = "/usr/karo/etc/karoS2S.info";

class RegistryTest : public ::testing::Test {
 protected:
  std::string File() const { return root_.Path(kRegistry); }
  void Write(const std::string& text) {
    ASSERT_EQ(S2SCheckServerInfo(), 0);
    ASSERT_TRUE(WriteFile(File(), text));
  }
  std::string Value(const char* section, const char* key) {
    KSZHASH* h = KLIBCSzHashAlloc(64);
    std::string out = "<none>";
    if (S2SGetServerInfo(section, h) == 1 &&
        KLIBCSzHashGetValue(h, key) != nullptr) {
      out = KLIBCSzHashGetValue(h, key);
    }
    KLIBCSzHashFree(h);
    return out;
  }

  TempRoot root_;
  SyslogCapture syslog_;
};

KSZHASH* Hash(std::initializer_list<std::pair<const char*, const char*>> kv) {
  KSZHASH* h = KLIBCSzHashAlloc(16);
  for (const auto& p : kv) KLIBCSzHashSetValue(h, p.first, p.second);
  return h;
}

TEST_F(RegistryTest, CheckServerInfoCreatesTheFileUnderTheRoot) {
  ASSERT_EQ(S2SCheckServerInfo(), 0);
  struct stat st;
  ASSERT_EQ(stat(File().c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0644u);
  EXPECT_EQ(S2SCheckServerInfo(), 0);
}

TEST_F(RegistryTest, IsSyncedShareFollowsRunningIdAndTheSwitch) {
  EXPECT_EQ(KAROS2SIsSyncedShare("docs"), 0);  // no registry file at all
  EXPECT_EQ(syslog_.Messages().size(), 0u);
  EXPECT_EQ(KAROS2SIsSyncedShare(""), 0);
  EXPECT_EQ(KLIBCErrGet(), KERR_INVALID_ARG);

  Write("[SHARE_docs]\n\tRunningID=\"c1\"\n[SHARE_idle]\n\tRunningID=\"\"\n");
  EXPECT_EQ(KAROS2SIsSyncedShare("docs"), 1);
  EXPECT_EQ(KAROS2SIsSyncedShare("idle"), 0);
  EXPECT_EQ(KAROS2SIsSyncedShare("other"), 0);
  ASSERT_EQ(KAROUISetS2S(0, nullptr, nullptr), 0);
  EXPECT_EQ(KAROS2SIsSyncedShare("docs"), 0);
  ASSERT_EQ(KAROUISetS2S(1, nullptr, nullptr), 0);
  EXPECT_EQ(KAROS2SIsSyncedShare("docs"), 1);
  EXPECT_EQ(syslog_.Messages().size(), 0u);

  Write("[SHARE_docs]\n\tRunningID=\"" + std::string(300, 'x') + "\"\n");
  EXPECT_EQ(KAROS2SIsSyncedShare("docs"), 0);
  EXPECT_NE(syslog_.Text().find("is_syncedshare:"), std::string::npos);
  EXPECT_NE(syslog_.Text().find("KLIBCFileGetSectionValue error. "
                                "key:[SHARE_docs] errno=[0x2400]"),
            std::string::npos);
}

TEST_F(RegistryTest, SetS2SKeepsTheClientUnlessBothAreGiven) {
  ASSERT_EQ(KAROUISetS2S(1, "c1", "srv1"), 0);
  ASSERT_EQ(KAROUISetS2S(1, nullptr, nullptr), 0);
  EXPECT_EQ(Value("PairedClientInfo", "clientID"), "c1");
  ASSERT_EQ(KAROUISetS2S(0, "c2", nullptr), 0);
  EXPECT_EQ(Value("PairedClientInfo", "clientID"), "c1");
  EXPECT_EQ(Value("PairedClientInfo", "s2sEnabled"), "no");
  ASSERT_EQ(KAROUISetS2S(1, "c2", "srv2"), 0);
  EXPECT_EQ(Value("PairedClientInfo", "serverName"), "srv2");
  EXPECT_EQ(KAROUISetS2S(1, "bad\nid", "srv"), -1);
  EXPECT_EQ(Value("PairedClientInfo", "clientID"), "c2");
}

TEST_F(RegistryTest, UpdateServerInfoAppendsOrReplaces) {
  KSZHASH* a = Hash({{"k1", "1"}, {"k2", "2"}});
  KSZHASH* b = Hash({{"k2", "two"}});
  ASSERT_EQ(S2SUpdateServerInfo("A", a), 0);
  ASSERT_EQ(S2SUpdateServerInfo("B", a), 0);
  ASSERT_EQ(S2SUpdateServerInfo("A", b), 0);
  EXPECT_EQ(Value("A", "k1"), "<none>");
  EXPECT_EQ(Value("A", "k2"), "two");
  EXPECT_EQ(Value("B", "k1"), "1");

  syslog_.Clear();
  EXPECT_EQ(S2SUpdateServerInfo("C]", a), -1);
  EXPECT_EQ(S2SUpdateServerInfo(nullptr, a), -1);
  const auto msgs = syslog_.Messages();
  ASSERT_EQ(msgs.size(), 4u);
  EXPECT_EQ(msgs[0], "KLIBCFileAddSection() failed!! szFile=[" + File() +
                         "], section=[C]], errno=[0x2300]");
  EXPECT_EQ(msgs[1], "Set section [C] ] value into [" + File() + "] error.");
  EXPECT_EQ(msgs[3], "Set section [ ] value into [" + File() + "] error.");

  Write("[A]\nno equals sign\n");
  syslog_.Clear();
  EXPECT_EQ(S2SUpdateServerInfo("A", b), -1);
  EXPECT_EQ(syslog_.Messages()[0], "KLIBCFileGetSection error. filePath:[" +
                                       File() +
                                       "] szOldSecName:[A]  iRet:[-1]");
  KLIBCSzHashFree(a);
  KLIBCSzHashFree(b);
}

TEST_F(RegistryTest, ShareAndTaskRecords) {
  KSZHASH* v = Hash({{"RunningID", "c1"}});
  ASSERT_EQ(S2SServerUpdateShare("docs", v), 0);
  ASSERT_EQ(S2SServerUpdateTask("t1", v), 0);
  char buf[16];
  EXPECT_EQ(S2SServerGetShare("docs", "RunningID", buf, sizeof buf), 2);
  EXPECT_STREQ(buf, "c1");
  EXPECT_EQ(Value("TASK_t1", "RunningID"), "c1");
  EXPECT_EQ(S2SServerGetShare("docs", "CompleteID", buf, sizeof buf), -1);
  EXPECT_EQ(KLIBCErrGet(), KERR_NOT_FOUND);
  EXPECT_EQ(S2SServerGetShare(nullptr, "RunningID", buf, sizeof buf), -1);
  EXPECT_EQ(S2SServerUpdateShare("", v), -1);
  // Names from the network that a section cannot hold are refused whole.
  const std::string before = ReadFile(File());
  EXPECT_EQ(S2SServerUpdateShare("x]\n[PairedClientInfo", v), -1);
  EXPECT_EQ(S2SServerUpdateTask("t\n", v), -1);
  EXPECT_EQ(ReadFile(File()), before);
  KLIBCSzHashFree(v);
}

TEST_F(RegistryTest, PairingMovesToManyClientMode) {
  EXPECT_EQ(S2SServerIfOldClientPaired(), 0);  // nothing paired yet
  ASSERT_EQ(KAROUISetS2S(1, "c1", "srv1"), 0);
  EXPECT_EQ(S2SServerIfOldClientPaired(), 1);

  EXPECT_EQ(S2SServerUpdatePairInfo("c1", ""), S2S_SVR_BAD_ARGUMENT);
  EXPECT_EQ(Value("CLIENTID_c1", "ServerName"), "<none>");
  EXPECT_EQ(S2SServerUpdatePairInfo("c1]", "srv1"), S2S_SVR_WRITE_ERROR);
  EXPECT_EQ(S2SServerUpdatePairInfo("c1", "srv1"), S2S_SVR_OK);
  EXPECT_EQ(Value("CLIENTID_c1", "ServerName"), "srv1");
  EXPECT_EQ(Value("PairedClientInfo", "clientID"), S2S_MULTI_SRC_MARKER);
  EXPECT_EQ(Value("PairedClientInfo", "s2sEnabled"), "yes");
  EXPECT_EQ(S2SServerIfOldClientPaired(), 0);

  KSZHASH* half = Hash({{"clientID", S2S_MULTI_SRC_MARKER}});
  EXPECT_EQ(S2SServerSetPairValue(nullptr), S2S_SVR_BAD_ARGUMENT);
  EXPECT_EQ(S2SServerSetPairValue(half), S2S_SVR_VALUE_ERROR);
  KLIBCSzHashSetValue(half, "serverName", "srv9");
  EXPECT_EQ(S2SServerSetPairValue(half), S2S_SVR_OK);
  EXPECT_EQ(S2SServerIfOldClientPaired(), 1);  // marker id, real name
  KLIBCSzHashSetValue(half, "serverName", "two\nlines");
  EXPECT_EQ(S2SServerSetPairValue(half), S2S_SVR_WRITE_ERROR);
  KLIBCSzHashFree(half);

  Write("garbage\n");
  EXPECT_EQ(S2SServerIfOldClientPaired(), -1);
  EXPECT_NE(syslog_.Text().find("Get server paired-info error."),
            std::string::npos);
}

TEST_F(RegistryTest, ResetPairRemembersTheOldClient) {
  ASSERT_EQ(KAROUISetS2S(1, "c1", "srv1"), 0);
  ASSERT_EQ(s2s_svr_reset_pair(), 0);
  EXPECT_EQ(Value("CLIENTID_c1", "ServerName"), "srv1");
  EXPECT_EQ(Value("PairedClientInfo", "serverName"), S2S_MULTI_SRC_MARKER);
  EXPECT_EQ(Value("PairedClientInfo", "s2sEnabled"), "yes");

  Write("");
  syslog_.Clear();
  ASSERT_EQ(s2s_svr_reset_pair(), 0);
  EXPECT_EQ(syslog_.Text(), "Failed to get clientID from hash.");
  EXPECT_EQ(Value("PairedClientInfo", "clientID"), S2S_MULTI_SRC_MARKER);
}

TEST_F(RegistryTest, CheckIfSharePairedSortsByFeeder) {
  Write(
      "[SHARE_free]\n[SHARE_mine]\n\tCompleteID=\"me\"\n"
      "[SHARE_running]\n\tCompleteID=\"me\"\n\tRunningID=\"other\"\n"
      "[SHARE_done]\n\tCompleteID=\"other\"\n"
      "[SHARE_back]\n\tCompleteID=\"other\"\n\tRunningID=\"me\"\n");
  KSZLIST* shares = KLIBCSzListAlloc();
  for (const char* s : {"free", "mine", "running", "done", "back", "new"}) {
    KLIBCSzListPush(shares, s);
  }
  KSZLIST* lists[3] = {KLIBCSzListAlloc(), KLIBCSzListAlloc(),
                       KLIBCSzListAlloc()};
  ASSERT_EQ(S2SCheckIfSharePaired(shares, "me", lists[0], lists[1], lists[2]),
            S2S_SVR_OK);
  auto joined = [](const KSZLIST* l) {
    std::string out;
    for (int i = 0; i < KLIBCSzListCount(l); ++i) {
      out += std::string(i ? ":" : "") + KLIBCSzListGet(l, i);
    }
    return out;
  };
  EXPECT_EQ(joined(lists[0]), "free:new");
  EXPECT_EQ(joined(lists[1]), "mine:back");
  EXPECT_EQ(joined(lists[2]), "running:done");

  EXPECT_EQ(S2SCheckIfSharePaired(shares, "", lists[0], lists[1], lists[2]),
            S2S_SVR_BAD_ARGUMENT);
  EXPECT_NE(syslog_.Text().find("Input parameters are null or empty!"),
            std::string::npos);
  KLIBCSzListPush(shares, "");
  EXPECT_EQ(S2SCheckIfSharePaired(shares, "me", lists[0], lists[1], lists[2]),
            S2S_SVR_BAD_ARGUMENT);

  Write("[SHARE_free]\n\tCompleteID=\"" + std::string(300, 'x') + "\"\n");
  syslog_.Clear();
  EXPECT_EQ(S2SCheckIfSharePaired(shares, "me", lists[0], lists[1], lists[2]),
            S2S_SVR_READ_ERROR);
  EXPECT_EQ(syslog_.Text(),
            "Failed to get section [SHARE_free] CompleteID value."
            "getSharePairStatus error");
  for (KSZLIST* l : lists) KLIBCSzListFree(l);
  KLIBCSzListFree(shares);
}

}  // namespace
