#include <gtest/gtest.h>
#include <pthread.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <string>
#include <thread>

#include "karo_err.h"
#include "karo_process.h"
#include "testutil.h"

namespace {

using s2s_test::WriteFile;

const char* const kEnd = nullptr;

TEST(PopenTest, ArgumentsReachTheProgramUninterpretedBothWays) {
  FILE* f = KLIBCPopen("printf", "r", "%s|%s", "$HOME; echo x", "*", kEnd);
  ASSERT_NE(f, nullptr);
  char line[64] = "";
  EXPECT_EQ(fread(line, 1, sizeof line - 1, f), 15u);
  EXPECT_STREQ(line, "$HOME; echo x|*");
  EXPECT_EQ(KLIBCPclose(f), 0);
  // The child's exit status comes back: 3 only when the line arrived whole.
  f = KLIBCPopen("sh", "w", "-c",
                 "read x && [ \"$x\" = 'to the child' ] && exit 3", kEnd);
  ASSERT_NE(f, nullptr);
  fputs("to the child\n", f);
  EXPECT_EQ(KLIBCPclose(f), 3);

  EXPECT_EQ(KLIBCPopen("s2s-no-such-program", "r", kEnd), nullptr);
  EXPECT_EQ(KLIBCErrGet(), KERR_NOT_FOUND);
  EXPECT_EQ(KLIBCPopen("true", "rw", kEnd), nullptr);
  EXPECT_EQ(KLIBCErrGet(), KERR_INVALID_ARG);
  EXPECT_EQ(KLIBCPclose(stdin), -1);
}

void Interrupt(int) {}

// An interrupted read (no SA_RESTART, as in the client) ends the program too.
TEST(PopenTest, SignalDuringTheReadEndsTheProgram) {
  struct sigaction sa = {}, old_sa;
  sa.sa_handler = Interrupt;
  ASSERT_EQ(0, sigaction(SIGUSR1, &sa, &old_sa));
  FILE* f = KLIBCPopen("sleep", "r", "60", kEnd);
  ASSERT_NE(f, nullptr);
  // Signals until one lands while fgets waits.
  std::atomic<bool> read_over{false};
  pthread_t reader = pthread_self();
  std::thread signaller([&] {
    while (!read_over) {
      pthread_kill(reader, SIGUSR1);
      usleep(10000);
    }
  });
  char line[16];
  EXPECT_EQ(nullptr, fgets(line, sizeof line, f));
  read_over = true;
  signaller.join();
  EXPECT_EQ(128 + SIGTERM, KLIBCPclose(f));
  sigaction(SIGUSR1, &old_sa, nullptr);
}

TEST(PidFileTest, OnlyALiveProcessCounts) {
  s2s_test::TempDir dir;
  const std::string file = dir.Sub("pid");
  EXPECT_EQ(KLIBCProcAliveByPidFile(file.c_str()), 0);
  EXPECT_EQ(KLIBCErrGet(), KERR_FILE_NOT_FOUND);
  ASSERT_TRUE(WriteFile(file, std::to_string(getpid()) + "\n"));
  EXPECT_EQ(KLIBCProcAliveByPidFile(file.c_str()), 1);
  for (const char* bad : {"", "12x\n", "-5\n", "0"}) {
    ASSERT_TRUE(WriteFile(file, bad));
    EXPECT_EQ(KLIBCProcAliveByPidFile(file.c_str()), 0) << bad;
    EXPECT_EQ(KLIBCErrGet(), KERR_FILE_FORMAT);
  }
  // A child that has exited but is not reaped yet is a zombie: not alive.
  pid_t child = fork();
  ASSERT_GE(child, 0);
  if (child == 0) _exit(0);
  siginfo_t info;
  ASSERT_EQ(waitid(P_PID, child, &info, WEXITED | WNOWAIT), 0);
  ASSERT_TRUE(WriteFile(file, std::to_string(child)));
  EXPECT_EQ(KLIBCProcAliveByPidFile(file.c_str()), 0);
  ASSERT_EQ(waitpid(child, nullptr, 0), child);
  EXPECT_EQ(KLIBCProcAliveByPidFile(file.c_str()), 0);
  EXPECT_EQ(KLIBCErrGet(), KERR_NOT_FOUND);
}

}  // namespace
