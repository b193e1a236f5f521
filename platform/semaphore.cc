// Binary System V semaphores shared by every process that names the same key.
//
// A new set starts at 0 and is raised to 1 by its creator with semop, which
// also stamps sem_otime. A process that finds the set already there waits for
// that stamp, so it never takes a lock that its creator has not initialised
// yet. Lock and unlock use SEM_UNDO: a holder that dies gives the lock back.
#include <errno.h>
#include <sys/ipc.h>
#include <sys/sem.h>
#include <time.h>

#include "karo_err.h"
#include "karo_section.h"

namespace {

// Owner read/write only: the writers run as one user, and nobody else may
// hold their lock.
const int kMode = 0600;
// How long an opener waits for a creator to initialise the set. A creator
// killed in between leaves a set nobody can use; failing is better than a
// hang.
const int kInitWaitMs = 5000;

int Op(int handle, short delta) {
  struct sembuf op = {0, delta, SEM_UNDO};
  while (semop(handle, &op, 1) != 0) {
    if (errno != EINTR) {
      KLIBCErrSet(KERR_LOCK);
      return -1;
    }
  }
  return 0;
}

int WaitInitialised(int id) {
  for (int waited = 0; waited < kInitWaitMs; ++waited) {
    struct semid_ds ds;
    if (semctl(id, 0, IPC_STAT, &ds) != 0) break;
    if (ds.sem_otime != 0) return id;
    struct timespec ms = {0, 1000 * 1000};
    nanosleep(&ms, nullptr);
  }
  KLIBCErrSet(KERR_LOCK);
  return -1;
}

}  // namespace

extern "C" int KLIBCSemOpen(int key) {
  if (key == IPC_PRIVATE) {
    KLIBCErrSet(KERR_LOCK);
    return -1;
  }
  for (;;) {
    int id = semget(key, 1, IPC_CREAT | IPC_EXCL | kMode);
    if (id >= 0) {
      // The initial raise carries no undo: the value 1 outlives its creator.
      struct sembuf op = {0, 1, 0};
      if (semop(id, &op, 1) != 0) {
        KLIBCErrSet(KERR_LOCK);
        return -1;
      }
      return id;
    }
    if (errno != EEXIST) break;
    id = semget(key, 1, kMode);
    if (id >= 0) return WaitInitialised(id);
    // Removed between the two calls: try creating it again.
    if (errno != ENOENT) break;
  }
  KLIBCErrSet(KERR_LOCK);
  return -1;
}

extern "C" int KLIBCSemLock(int handle) { return Op(handle, -1); }

extern "C" int KLIBCSemLockTimed(int handle, int timeout_ms) {
  if (timeout_ms < 0) return Op(handle, -1);
  struct timespec deadline;
  clock_gettime(CLOCK_MONOTONIC, &deadline);
  deadline.tv_sec += timeout_ms / 1000;
  deadline.tv_nsec += (timeout_ms % 1000) * 1000000L;
  if (deadline.tv_nsec >= 1000000000L) {
    deadline.tv_sec += 1;
    deadline.tv_nsec -= 1000000000L;
  }
  struct sembuf op = {0, -1, SEM_UNDO};
  for (;;) {
    // semtimedop takes a relative wait: what is left after an interruption.
    struct timespec now, left;
    clock_gettime(CLOCK_MONOTONIC, &now);
    left.tv_sec = deadline.tv_sec - now.tv_sec;
    left.tv_nsec = deadline.tv_nsec - now.tv_nsec;
    if (left.tv_nsec < 0) {
      left.tv_sec -= 1;
      left.tv_nsec += 1000000000L;
    }
    if (left.tv_sec < 0) left = {0, 0};
    if (semtimedop(handle, &op, 1, &left) == 0) return 0;
    if (errno != EINTR) break;
  }
  KLIBCErrSet(KERR_LOCK);
  return -1;
}

extern "C" int KLIBCSemUnlock(int handle) { return Op(handle, 1); }

extern "C" int KLIBCSemClose(int handle) {
  struct semid_ds ds;
  if (handle < 0 || semctl(handle, 0, IPC_STAT, &ds) != 0) {
    KLIBCErrSet(KERR_INVALID_ARG);
    return -1;
  }
  return 0;
}

extern "C" int KLIBCSemSetOwner(int handle, unsigned int uid,
                                unsigned int gid) {
  struct semid_ds ds;
  if (handle < 0 || semctl(handle, 0, IPC_STAT, &ds) != 0) {
    KLIBCErrSet(KERR_LOCK);
    return -1;
  }
  if (ds.sem_perm.uid == uid && ds.sem_perm.gid == gid) return 0;
  ds.sem_perm.uid = uid;
  ds.sem_perm.gid = gid;
  if (semctl(handle, 0, IPC_SET, &ds) != 0) {
    KLIBCErrSet(KERR_LOCK);
    return -1;
  }
  return 0;
}
