#include "rsync_child.h"

#include <errno.h>
#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <string.h>
#include <sys/prctl.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include "karo/rsync_wrapper.h"
#include "rsync_log.h"

extern char** environ;

namespace KARO {
namespace Backup {
namespace detail {

const int kKillGraceMs = 500;

namespace {

const int kPollMs = 50;
const int kDeleteLimitStatus = 25;
const size_t kMaxOutput = 64 * 1024;
const size_t kMaxErrorLine = 300;

thread_local std::string t_last_error;

bool StartsWith(const std::string& s, const char* prefix) {
  return s.compare(0, strlen(prefix), prefix) == 0;
}

long long NowMs() {
  timespec ts;
  clock_gettime(CLOCK_MONOTONIC, &ts);
  return ts.tv_sec * 1000LL + ts.tv_nsec / 1000000;
}

// The parent's environment without any password of its own, plus ours.
std::vector<std::string> ChildEnvironment(const std::string& password) {
  std::vector<std::string> env;
  for (char** e = environ; e != nullptr && *e != nullptr; ++e) {
    if (strncmp(*e, "RSYNC_PASSWORD=", 15) != 0) env.push_back(*e);
  }
  if (!password.empty()) env.push_back("RSYNC_PASSWORD=" + password);
  return env;
}

std::vector<char*> Pointers(std::vector<std::string>& strings) {
  std::vector<char*> out;
  for (std::string& s : strings) out.push_back(&s[0]);
  out.push_back(nullptr);
  return out;
}

// Only async-signal-safe calls between fork and exec. rsync gets a session
// of its own here and nowhere else (a setpgid from the parent would race
// with it and could make setsid fail), and SIGTERM when its parent dies,
// so that a killed client never leaves rsync pushing on. `report_fd` is
// close-on-exec: its end of file tells the parent that all this is done.
[[noreturn]] void ExecChild(int out_fd, int report_fd, pid_t parent,
                            unsigned long long max_file_size, char* const* argv,
                            char* const* envp) {
  if (setsid() < 0) _exit(127);
  // The parent may have died before the death signal was armed.
  if (prctl(PR_SET_PDEATHSIG, SIGTERM) != 0 || getppid() != parent) {
    _exit(127);
  }
  if (max_file_size > 0) {
    rlimit limit = {max_file_size, max_file_size};
    if (setrlimit(RLIMIT_FSIZE, &limit) != 0) _exit(127);
  }
  int null_fd = open("/dev/null", O_RDONLY);
  if (null_fd >= 0) dup2(null_fd, 0);
  dup2(out_fd, 1);
  dup2(out_fd, 2);
  execvpe(argv[0], argv, envp);
  int err = errno;
  ssize_t ignored = write(report_fd, &err, sizeof err);
  (void)ignored;
  _exit(127);
}

// Waits until the child has exec'd (end of file on the report pipe) or
// failed to (an errno in it). Returns false on failure.
bool ChildStarted(int report_fd) {
  int err = 0;
  ssize_t n;
  while ((n = read(report_fd, &err, sizeof err)) < 0 && errno == EINTR) {
  }
  return n == 0;
}

int PidFd(pid_t pid) {
#ifdef SYS_pidfd_open
  return static_cast<int>(syscall(SYS_pidfd_open, pid, 0));
#else
  (void)pid;
  return -1;
#endif
}

// Output as it arrives, split into lines at \r and \n, the progress
// parser's lines taken out.
struct OutputReader {
  ProgressParser* progress;
  std::string* output;
  std::string pending;

  void Keep(const std::string& text) {
    size_t room = kMaxOutput - std::min(kMaxOutput, output->size());
    output->append(text, 0, std::min(room, text.size()));
  }
  void Take(const char* data, size_t n) {
    if (progress == nullptr) {
      Keep(std::string(data, n));
      return;
    }
    pending.append(data, n);
    size_t start = 0;
    for (size_t end;
         (end = pending.find_first_of("\r\n", start)) != std::string::npos;
         start = end + 1) {
      std::string line = pending.substr(start, end - start);
      if (!progress->Feed(line)) Keep(line + "\n");
    }
    pending.erase(0, start);
    if (pending.size() > kMaxOutput) {
      Keep(pending);
      pending.clear();
    }
  }
  void Finish() {
    if (!pending.empty() && (progress == nullptr || !progress->Feed(pending))) {
      Keep(pending);
    }
    pending.clear();
  }
};

// Reads what is available; false once the pipe is at its end.
bool Drain(int fd, OutputReader* reader) {
  char buf[4096];
  for (;;) {
    ssize_t n = read(fd, buf, sizeof buf);
    if (n > 0) {
      reader->Take(buf, static_cast<size_t>(n));
      continue;
    }
    if (n < 0 && errno == EINTR) continue;
    return n < 0 && errno == EAGAIN;
  }
}

bool Exited(pid_t pid) {
  siginfo_t info;
  info.si_pid = 0;
  int rc = waitid(P_PID, pid, &info, WEXITED | WNOHANG | WNOWAIT);
  return rc == 0 && info.si_pid == pid;
}

}  // namespace

std::string ErrorLine(const std::string& output) {
  std::string refusal, complaint, summary;
  size_t start = 0;
  while (start < output.size()) {
    size_t end = output.find_first_of("\r\n", start);
    if (end == std::string::npos) end = output.size();
    std::string line = output.substr(start, end - start);
    start = end + 1;
    if (refusal.empty() && StartsWith(line, "@ERROR: ")) {
      refusal = line.substr(8);
    } else if (complaint.empty() && StartsWith(line, "rsync: ")) {
      complaint = line.substr(7);
      // "[receiver] ", "[sender] ": which side of rsync noticed.
      if (!complaint.empty() && complaint[0] == '[') {
        size_t close = complaint.find("] ");
        if (close != std::string::npos) complaint.erase(0, close + 2);
      }
    } else if (summary.empty() && StartsWith(line, "rsync error: ")) {
      summary = line.substr(13);
      size_t at = summary.rfind(" at ");
      if (at != std::string::npos) summary.erase(at);
    }
  }
  std::string line = !refusal.empty()     ? refusal
                     : !complaint.empty() ? complaint
                                          : summary;
  for (char& c : line) {
    if (static_cast<unsigned char>(c) < 0x20) c = ' ';
  }
  if (line.size() > kMaxErrorLine) line.resize(kMaxErrorLine);
  return line;
}

void SetLastError(const std::string& text) { t_last_error = text; }

const std::string& LastError() { return t_last_error; }

ChildOutcome RunRsync(const std::vector<std::string>& args,
                      const std::string& password,
                      const boost::function<bool()>& cancel,
                      unsigned long long max_file_size,
                      ProgressParser* progress) {
  ChildOutcome outcome;
  OutputReader reader = {progress, &outcome.output, ""};
  std::vector<std::string> arg_strings = args;
  std::vector<std::string> env_strings = ChildEnvironment(password);
  std::vector<char*> argv = Pointers(arg_strings);
  std::vector<char*> envp = Pointers(env_strings);

  int pipe_fds[2];
  int report[2];
  if (pipe2(pipe_fds, O_CLOEXEC) != 0) {
    Log(LOG_ERR, "cannot make a pipe for rsync: %s", strerror(errno));
    outcome.status = RsyncWrapper::kStartFailed;
    return outcome;
  }
  if (pipe2(report, O_CLOEXEC) != 0) {
    Log(LOG_ERR, "cannot make a pipe for rsync: %s", strerror(errno));
    close(pipe_fds[0]);
    close(pipe_fds[1]);
    outcome.status = RsyncWrapper::kStartFailed;
    return outcome;
  }
  pid_t parent = getpid();
  pid_t pid = fork();
  if (pid == 0) {
    ExecChild(pipe_fds[1], report[1], parent, max_file_size, argv.data(),
              envp.data());
  }
  close(pipe_fds[1]);
  close(report[1]);
  if (pid < 0) {
    Log(LOG_ERR, "cannot start rsync: %s", strerror(errno));
    close(pipe_fds[0]);
    close(report[0]);
    outcome.status = RsyncWrapper::kStartFailed;
    return outcome;
  }
  // Once exec'd, rsync leads its own group: a cancel reaches all of it.
  bool started = ChildStarted(report[0]);
  close(report[0]);
  int out_fd = pipe_fds[0];
  fcntl(out_fd, F_SETFL, fcntl(out_fd, F_GETFL) | O_NONBLOCK);
  int pid_fd = PidFd(pid);

  long long term_at = 0;
  bool killed = false;
  while (!Exited(pid)) {
    pollfd fds[2];
    int nfds = 0;
    if (out_fd >= 0) fds[nfds++] = {out_fd, POLLIN, 0};
    if (pid_fd >= 0) fds[nfds++] = {pid_fd, POLLIN, 0};
    poll(fds, nfds, kPollMs);
    if (out_fd >= 0 && !Drain(out_fd, &reader)) {
      close(out_fd);
      out_fd = -1;
    }
    if (!outcome.cancelled && cancel && cancel()) {
      outcome.cancelled = true;
      term_at = NowMs();
      kill(-pid, SIGTERM);
    }
    if (outcome.cancelled && !killed && NowMs() - term_at >= kKillGraceMs) {
      killed = true;
      kill(-pid, SIGKILL);
    }
  }
  // Helpers rsync started (ssh) must not outlive a cancelled run.
  if (outcome.cancelled) kill(-pid, SIGKILL);
  int wstatus = 0;
  while (waitpid(pid, &wstatus, 0) < 0 && errno == EINTR) {
  }
  if (out_fd >= 0) {
    Drain(out_fd, &reader);
    close(out_fd);
  }
  reader.Finish();
  if (pid_fd >= 0) close(pid_fd);

  if (outcome.cancelled) {
    outcome.status = RsyncWrapper::kCancelled;
  } else if (!started || (WIFEXITED(wstatus) && WEXITSTATUS(wstatus) == 127)) {
    Log(LOG_ERR, "cannot run %s", args[0].c_str());
    outcome.status = RsyncWrapper::kStartFailed;
  } else if (WIFEXITED(wstatus)) {
    outcome.status = WEXITSTATUS(wstatus);
  } else {
    Log(LOG_ERR, "rsync died of signal %d", WTERMSIG(wstatus));
    outcome.status = RsyncWrapper::kCancelled;
  }
  return outcome;
}

int RunAndLog(const std::vector<std::string>& args, const RsyncSettings& s,
              const boost::function<bool()>& cancel, const char* what,
              std::string* output, unsigned long long max_file_size,
              ProgressParser* progress) {
  ChildOutcome outcome =
      RunRsync(args, s.password, cancel, max_file_size, progress);
  // rsync's 25 says only that --max-delete held deletions back, which is
  // what it was asked to do (a daemon's client exits 0 for it).
  if (outcome.status == kDeleteLimitStatus && progress != nullptr &&
      progress->stats().deletions_skipped > 0) {
    outcome.status = 0;
  }
  if (output != nullptr) *output = outcome.output;
  std::string last;
  size_t start = 0;
  while (start < outcome.output.size()) {
    size_t end = outcome.output.find('\n', start);
    if (end == std::string::npos) end = outcome.output.size();
    std::string line = outcome.output.substr(start, end - start);
    if (s.debug_log) Log(LOG_DEBUG, "rsync: %s", line.c_str());
    if (!line.empty()) last = line;
    start = end + 1;
  }
  if (outcome.cancelled) {
    Log(LOG_WARNING, "%s to %s cancelled", what, s.host.c_str());
  } else if (outcome.status != 0 &&
             outcome.status != RsyncWrapper::kStartFailed) {
    std::string why = ErrorLine(outcome.output);
    SetLastError(why);
    Log(LOG_ERR, "%s to %s failed with status %d: %s", what, s.host.c_str(),
        outcome.status, why.empty() ? last.c_str() : why.c_str());
  }
  return outcome.status;
}

}  // namespace detail
}  // namespace Backup
}  // namespace KARO
