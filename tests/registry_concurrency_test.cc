#include <gtest/gtest.h>
#include <signal.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <random>
#include <string>
#include <vector>

#include "S2S/is_syncedshare.h"
#include "testutil.h"

namespace {

using s2s_test::TempRoot;

const int kRounds = 40;

std::string Get(const char* section, const char* key) {
  KSZHASH* h = KLIBCSzHashAlloc(64);
  std::string out = "<none>";
  if (S2SGetServerInfo(section, h) == 1 &&
      KLIBCSzHashGetValue(h, key) != nullptr) {
    out = KLIBCSzHashGetValue(h, key);
  }
  KLIBCSzHashFree(h);
  return out;
}

// One writer's work: `who` picks what it writes, `i` the round.
bool WriteRound(int who, int i) {
  if (who == 0) return KAROUISetS2S(i % 2, nullptr, nullptr) == 0;
  KSZHASH* h = KLIBCSzHashAlloc(4);
  std::string n = std::to_string(i);
  int r;
  if (who == 1) {
    KLIBCSzHashSetValue(h, "clientID", ("c" + n).c_str());
    KLIBCSzHashSetValue(h, "serverName", ("srv" + n).c_str());
    r = S2SServerSetPairValue(h);
  } else {
    KLIBCSzHashSetValue(h, "RunningID", ("c" + std::to_string(who)).c_str());
    KLIBCSzHashSetValue(h, "round", n.c_str());
    std::string name = std::to_string(who);
    r = who % 2 ? S2SServerUpdateTask(name.c_str(), h)
                : S2SServerUpdateShare(name.c_str(), h);
  }
  KLIBCSzHashFree(h);
  return r == 0;
}

TEST(RegistryConcurrency, WritersOfDifferentSectionsAndKeysLoseNothing) {
  TempRoot root;
  ASSERT_EQ(S2SCheckServerInfo(), 0);
  const int kWriters = 6;
  std::vector<pid_t> pids;
  for (int who = 0; who < kWriters; ++who) {
    pid_t pid = fork();
    ASSERT_GE(pid, 0);
    if (pid == 0) {
      for (int i = 1; i <= kRounds; ++i) {
        if (!WriteRound(who, i)) _exit(1);
      }
      _exit(0);
    }
    pids.push_back(pid);
  }
  for (pid_t pid : pids) {
    int status;
    ASSERT_EQ(waitpid(pid, &status, 0), pid);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
  }
  const std::string last = std::to_string(kRounds);
  EXPECT_EQ(Get("PairedClientInfo", "s2sEnabled"), kRounds % 2 ? "yes" : "no");
  EXPECT_EQ(Get("PairedClientInfo", "clientID"), "c" + last);
  EXPECT_EQ(Get("PairedClientInfo", "serverName"), "srv" + last);
  for (int who = 2; who < kWriters; ++who) {
    std::string section = (who % 2 ? "TASK_" : "SHARE_") + std::to_string(who);
    EXPECT_EQ(Get(section.c_str(), "round"), last) << section;
  }
}

// Whatever moment a writer dies at, the registry stays readable by every
// function and the lock comes back.
TEST(RegistryConcurrency, WriterKilledAtRandomLeavesAUsableRegistry) {
  TempRoot root;
  ASSERT_TRUE(KAROUISetS2S(1, "c1", "srv1") == 0);
  std::mt19937 rng(2024);
  for (int round = 0; round < 10; ++round) {
    int progress[2];
    ASSERT_EQ(pipe(progress), 0);
    pid_t pid = fork();
    ASSERT_GE(pid, 0);
    if (pid == 0) {
      close(progress[0]);
      for (int i = 0;; ++i) {
        if (!WriteRound(i % 6, i)) _exit(1);
        if (write(progress[1], "x", 1) != 1) _exit(1);
      }
    }
    close(progress[1]);
    char c;
    for (int i = 0, n = 1 + static_cast<int>(rng() % 6); i < n; ++i) {
      ASSERT_EQ(read(progress[0], &c, 1), 1);
    }
    struct timespec pause = {0, static_cast<long>(rng() % 3000) * 1000};
    nanosleep(&pause, nullptr);
    kill(pid, SIGKILL);
    waitpid(pid, nullptr, 0);
    close(progress[0]);

    KSZHASH* h = KLIBCSzHashAlloc(64);
    EXPECT_EQ(S2SGetServerInfo("PairedClientInfo", h), 1);
    KLIBCSzHashFree(h);
    EXPECT_GE(S2SServerIfOldClientPaired(), 0);
    EXPECT_EQ(KAROS2SIsSyncedShare("2"),
              Get("PairedClientInfo", "s2sEnabled") == "yes");
    S2S_SVR_STATUS st;
    EXPECT_EQ(s2s_svr_get_status(&st), 0);
    EXPECT_NE(st.clientID, nullptr);
    s2s_svr_put_status(&st);
    KSZLIST* shares = KLIBCSzListAlloc();
    KSZLIST* out = KLIBCSzListAlloc();
    KLIBCSzListPush(shares, "2");
    EXPECT_EQ(S2SCheckIfSharePaired(shares, "c2", out, out, out), 0);
    KLIBCSzListFree(shares);
    KLIBCSzListFree(out);
    ASSERT_TRUE(WriteRound(2, 1000 + round));  // the lock was given back
  }
}

}  // namespace
