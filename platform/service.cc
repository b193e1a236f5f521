#include <errno.h>
#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <string.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <string>

#include "karo_err.h"
#include "karo_host.h"
#include "karo_process.h"
#include "karo_programs.h"
#include "karo_root.h"
#include "karo_service.h"
#include "spawn.h"

namespace {

const char kDaemonService[] = "s2s_daemon";
const char kDaemonPidFile[] = "/var/run/s2s_daemon.pid";
const char kDaemonProgram[] = "s2sd";

// Returns the pid file of a known service, or "" (KERR_NOT_FOUND /
// KERR_INVALID_ARG).
std::string PidFileOf(const char* name) {
  if (name == nullptr) {
    KLIBCErrSet(KERR_INVALID_ARG);
    return std::string();
  }
  if (strcmp(name, kDaemonService) != 0) {
    KLIBCErrSet(KERR_NOT_FOUND);
    return std::string();
  }
  return KaroRootPath(kDaemonPidFile);
}

std::string DaemonProgram() {
  char buf[4096];
  if (KaroPlatformConfGet("daemon_program", buf, sizeof buf) > 0) return buf;
  std::string found = KaroProgramPath(kDaemonProgram);
  return found.empty() ? kDaemonProgram : found;
}

// Creates every missing directory of `dir`.
bool MakeDirs(const std::string& dir) {
  for (size_t pos = 1; pos <= dir.size(); ++pos) {
    if (pos < dir.size() && dir[pos] != '/') continue;
    std::string part = dir.substr(0, pos);
    if (mkdir(part.c_str(), 0755) != 0 && errno != EEXIST) return false;
  }
  return true;
}

// Replaces the pid file in one step, so a reader never sees half a number.
bool WritePidFile(const std::string& path, pid_t pid) {
  if (!MakeDirs(path.substr(0, path.rfind('/')))) return false;
  std::string tmp = path + ".tmp";
  int fd = open(tmp.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
  if (fd < 0) return false;
  std::string text = std::to_string(pid) + "\n";
  bool ok =
      write(fd, text.data(), text.size()) == static_cast<ssize_t>(text.size());
  ok = (close(fd) == 0) && ok;
  if (!ok || rename(tmp.c_str(), path.c_str()) != 0) {
    unlink(tmp.c_str());
    return false;
  }
  return true;
}

// Waits up to `ms` for `pid` to end. True when it has.
bool WaitGone(pid_t pid, int ms) {
  int fd = static_cast<int>(syscall(SYS_pidfd_open, pid, 0));
  if (fd < 0) return errno == ESRCH;
  pollfd p{fd, POLLIN, 0};
  int rc;
  while ((rc = poll(&p, 1, ms)) < 0 && errno == EINTR) {
  }
  close(fd);
  return rc > 0;
}

}  // namespace

extern "C" int KLIBServiceIsRunning(const char* name) {
  std::string pid_file = PidFileOf(name);
  if (pid_file.empty()) return 0;
  return KLIBCProcAliveByPidFile(pid_file.c_str());
}

extern "C" int KLIBServiceStart(const char* name, int flags) {
  std::string pid_file = PidFileOf(name);
  if (pid_file.empty()) return -1;
  if (flags != 0) {
    KLIBCErrSet(KERR_INVALID_ARG);
    return -1;
  }
  if (KLIBCProcAliveByPidFile(pid_file.c_str())) {
    KLIBCErrSet(KERR_SERVICE_RUNNING);
    return -1;
  }
  std::string program = DaemonProgram();
  const char* argv[] = {program.c_str(), "--foreground", nullptr};
  pid_t pid =
      karo_detail::Spawn(argv, karo_detail::kDevNull, karo_detail::kDevNull,
                         karo_detail::kInherit, true);
  if (pid < 0) {
    KLIBCErrSet(KERR_SERVICE);
    return -1;
  }
  if (!WritePidFile(pid_file, pid)) {
    kill(pid, SIGTERM);
    KLIBCErrSet(KERR_SERVICE);
    return -1;
  }
  return 0;
}

extern "C" int KLIBServicePause(const char* name) {
  std::string pid_file = PidFileOf(name);
  if (pid_file.empty()) return -1;
  if (!KLIBCProcAliveByPidFile(pid_file.c_str())) {
    unlink(pid_file.c_str());
    return 0;
  }
  pid_t pid = KaroReadPidFile(pid_file.c_str());
  if (pid < 0 || (kill(pid, SIGTERM) != 0 && errno != ESRCH)) {
    KLIBCErrSet(KERR_SERVICE);
    return -1;
  }
  if (!WaitGone(pid, KARO_SERVICE_STOP_MS)) {
    kill(pid, SIGKILL);
    WaitGone(pid, KARO_SERVICE_STOP_MS);
  }
  unlink(pid_file.c_str());
  return 0;
}
