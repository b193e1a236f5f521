#include "spawn.h"

#include <errno.h>
#include <fcntl.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include "karo_err.h"

namespace karo_detail {

namespace {

// Reads exactly `size` bytes unless the writers all close first. Returns the
// number of bytes read.
size_t ReadFull(int fd, void* buf, size_t size) {
  size_t got = 0;
  while (got < size) {
    ssize_t n = read(fd, static_cast<char*>(buf) + got, size - got);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) break;
    got += static_cast<size_t>(n);
  }
  return got;
}

void WriteAll(int fd, const void* buf, size_t size) {
  const char* p = static_cast<const char*>(buf);
  while (size > 0) {
    ssize_t n = write(fd, p, size);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return;
    p += n;
    size -= static_cast<size_t>(n);
  }
}

// Runs in the child after fork: only async-signal-safe calls. Never returns.
[[noreturn]] void ExecChild(const char* const argv[], int in_fd, int out_fd,
                            int err_fd, int report_fd, bool detach) {
  int fds[3] = {in_fd, out_fd, err_fd};
  for (int target = 0; target < 3; ++target) {
    int fd = fds[target];
    if (fd == kInherit) continue;
    if (fd == kDevNull) fd = open("/dev/null", O_RDWR);
    if (fd < 0 || dup2(fd, target) < 0) {
      int err = errno;
      WriteAll(report_fd, &err, sizeof err);
      _exit(127);
    }
  }
  // A service outlives its caller: it must not keep the caller's files,
  // sockets or locks open. Best effort; an old kernel leaves them as they
  // are.
  if (detach) close_range(3, ~0U, CLOSE_RANGE_CLOEXEC);
  signal(SIGPIPE, SIG_DFL);
  execvp(argv[0], const_cast<char* const*>(argv));
  int err = errno;
  WriteAll(report_fd, &err, sizeof err);
  _exit(127);
}

}  // namespace

pid_t Spawn(const char* const argv[], int in_fd, int out_fd, int err_fd,
            bool detach) {
  // The report pipe is close-on-exec: a successful exec closes it, a failed
  // one writes errno into it. A detached start first sends the grandchild's
  // pid through it.
  int report[2];
  if (pipe2(report, O_CLOEXEC) != 0) {
    KLIBCErrSet(KERR_SYSTEM);
    return -1;
  }
  pid_t child = fork();
  if (child < 0) {
    close(report[0]);
    close(report[1]);
    KLIBCErrSet(KERR_SYSTEM);
    return -1;
  }
  if (child == 0) {
    close(report[0]);
    if (!detach) ExecChild(argv, in_fd, out_fd, err_fd, report[1], false);
    if (setsid() < 0) _exit(127);
    pid_t grandchild = fork();
    if (grandchild < 0) _exit(127);
    if (grandchild == 0) {
      ExecChild(argv, in_fd, out_fd, err_fd, report[1], true);
    }
    WriteAll(report[1], &grandchild, sizeof grandchild);
    _exit(0);
  }
  close(report[1]);
  pid_t pid = child;
  bool ok = true;
  if (detach) {
    int status = 0;
    while (waitpid(child, &status, 0) < 0 && errno == EINTR) {
    }
    ok = ReadFull(report[0], &pid, sizeof pid) == sizeof pid;
  }
  int exec_errno = 0;
  if (ok && ReadFull(report[0], &exec_errno, sizeof exec_errno) != 0) {
    ok = false;
    if (!detach) {
      while (waitpid(child, nullptr, 0) < 0 && errno == EINTR) {
      }
    }
  }
  close(report[0]);
  if (!ok) {
    KLIBCErrSet(exec_errno == 0 ? KERR_SYSTEM : KERR_NOT_FOUND);
    return -1;
  }
  return pid;
}

}  // namespace karo_detail
