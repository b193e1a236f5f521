#include <errno.h>
#include <fcntl.h>
#include <signal.h>
#include <stdarg.h>
#include <string.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <map>
#include <mutex>
#include <string>
#include <vector>

#include "karo_err.h"
#include "karo_process.h"
#include "spawn.h"

namespace {

// Children of the streams KLIBCPopen handed out, so that KLIBCPclose can wait
// for the right one.
std::mutex children_mutex;
std::map<FILE*, pid_t>& Children() {
  static std::map<FILE*, pid_t> children;
  return children;
}

int ExitStatus(int status) {
  if (WIFEXITED(status)) return WEXITSTATUS(status);
  if (WIFSIGNALED(status)) return 128 + WTERMSIG(status);
  return -1;
}

}  // namespace

extern "C" FILE* KLIBCPopen(const char* prog, const char* mode, ...) {
  if (prog == nullptr || *prog == '\0' || mode == nullptr ||
      (strcmp(mode, "r") != 0 && strcmp(mode, "w") != 0)) {
    KLIBCErrSet(KERR_INVALID_ARG);
    return nullptr;
  }
  std::vector<const char*> argv{prog};
  va_list ap;
  va_start(ap, mode);
  while (const char* arg = va_arg(ap, const char*)) argv.push_back(arg);
  va_end(ap);
  argv.push_back(nullptr);

  const bool reading = mode[0] == 'r';
  int fds[2];
  if (pipe2(fds, O_CLOEXEC) != 0) {
    KLIBCErrSet(KERR_SYSTEM);
    return nullptr;
  }
  int ours = reading ? fds[0] : fds[1];
  int theirs = reading ? fds[1] : fds[0];
  pid_t pid = karo_detail::Spawn(
      argv.data(), reading ? karo_detail::kDevNull : theirs,
      reading ? theirs : karo_detail::kInherit, karo_detail::kInherit, false);
  close(theirs);
  if (pid < 0) {
    close(ours);
    return nullptr;
  }
  FILE* stream = fdopen(ours, mode);
  if (stream == nullptr) {
    close(ours);
    kill(pid, SIGKILL);
    waitpid(pid, nullptr, 0);
    KLIBCErrSet(KERR_NO_MEMORY);
    return nullptr;
  }
  std::lock_guard<std::mutex> lock(children_mutex);
  Children()[stream] = pid;
  return stream;
}

extern "C" int KLIBCPclose(FILE* stream) {
  pid_t pid;
  {
    std::lock_guard<std::mutex> lock(children_mutex);
    auto it = Children().find(stream);
    if (stream == nullptr || it == Children().end()) {
      KLIBCErrSet(KERR_INVALID_ARG);
      return -1;
    }
    pid = it->second;
    Children().erase(it);
  }
  // A stream that saw a read error was interrupted by a signal: the caller
  // gave up on the program, which is ended rather than waited for (a name
  // lookup may wait seconds for an answer). So is one whose wait a signal
  // interrupts.
  bool interrupted = ferror(stream) != 0;
  fclose(stream);
  if (interrupted) kill(pid, SIGTERM);
  int status = 0;
  pid_t got;
  while ((got = waitpid(pid, &status, 0)) < 0 && errno == EINTR) {
    kill(pid, SIGTERM);
  }
  if (got < 0) {
    KLIBCErrSet(KERR_SYSTEM);
    return -1;
  }
  return ExitStatus(status);
}

extern "C" pid_t KaroReadPidFile(const char* path) {
  if (path == nullptr) {
    KLIBCErrSet(KERR_INVALID_ARG);
    return -1;
  }
  int fd = open(path, O_RDONLY | O_CLOEXEC);
  if (fd < 0) {
    KLIBCErrSet(KERR_FILE_NOT_FOUND);
    return -1;
  }
  char buf[32] = {0};
  ssize_t n = read(fd, buf, sizeof buf - 1);
  close(fd);
  char* end = nullptr;
  long pid = n > 0 ? strtol(buf, &end, 10) : 0;
  if (pid <= 0 || pid > 0x7fffffff || end == buf ||
      (*end != '\0' && *end != '\n')) {
    KLIBCErrSet(KERR_FILE_FORMAT);
    return -1;
  }
  return static_cast<pid_t>(pid);
}

extern "C" int KLIBCProcAliveByPidFile(const char* path) {
  pid_t pid = KaroReadPidFile(path);
  if (pid < 0) return 0;
  if (kill(pid, 0) != 0 && errno != EPERM) {
    KLIBCErrSet(KERR_NOT_FOUND);
    return 0;
  }
  // A zombie still answers kill(0) but will never do any work again.
  std::string stat = "/proc/" + std::to_string(pid) + "/stat";
  int fd = open(stat.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd >= 0) {
    char buf[512] = {0};
    ssize_t n = read(fd, buf, sizeof buf - 1);
    close(fd);
    const char* paren = n > 0 ? strrchr(buf, ')') : nullptr;
    if (paren != nullptr && paren[1] == ' ' && paren[2] == 'Z') {
      KLIBCErrSet(KERR_NOT_FOUND);
      return 0;
    }
  }
  return 1;
}
