#include <gtest/gtest.h>
#include <signal.h>
#include <sys/ipc.h>
#include <sys/sem.h>
#include <sys/wait.h>
#include <unistd.h>

#include "karo_err.h"
#include "karo_section.h"

namespace {

// Each test process uses a key of its own and removes the set afterwards, so
// parallel tests never share a lock.
class SemaphoreTest : public ::testing::Test {
 protected:
  void TearDown() override {
    int id = semget(key_, 1, 0);
    if (id >= 0) semctl(id, 0, IPC_RMID);
  }
  const int key_ = 0x53320000 | (getpid() & 0xffff);
};

// Whether it was taken with or without a deadline.
TEST_F(SemaphoreTest, HolderKilledGivesTheLockBack) {
  for (bool timed : {false, true}) {
    int held[2];
    ASSERT_EQ(pipe(held), 0);
    pid_t pid = fork();
    ASSERT_GE(pid, 0);
    if (pid == 0) {
      int sem = KLIBCSemOpen(key_);
      if (sem < 0 ||
          (timed ? KLIBCSemLockTimed(sem, 1000) : KLIBCSemLock(sem)) != 0 ||
          write(held[1], "x", 1) != 1) {
        _exit(1);
      }
      pause();
      _exit(0);
    }
    char c;
    ASSERT_EQ(read(held[0], &c, 1), 1);
    kill(pid, SIGKILL);
    waitpid(pid, nullptr, 0);
    close(held[0]);
    close(held[1]);
    int sem = KLIBCSemOpen(key_);
    ASSERT_GE(sem, 0);
    EXPECT_EQ(KLIBCSemLockTimed(sem, 1000), 0) << timed;
    EXPECT_EQ(semctl(sem, 0, GETVAL), 0);
    EXPECT_EQ(KLIBCSemUnlock(sem), 0);
    EXPECT_EQ(semctl(sem, 0, GETVAL), 1);
    EXPECT_EQ(KLIBCSemClose(sem), 0);
  }
  EXPECT_EQ(KLIBCSemOpen(IPC_PRIVATE), -1);
  EXPECT_EQ(KLIBCErrGet(), KERR_LOCK);
  EXPECT_EQ(KLIBCSemClose(-1), -1);
}

}  // namespace
