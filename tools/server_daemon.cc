#include "server_daemon.h"

#include <arpa/inet.h>
#include <errno.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <signal.h>
#include <stdio.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <sstream>

#include "daemon_config.h"
#include "karo_process.h"
#include "karo_root.h"
#include "server_root.h"
#include "server_shares.h"

namespace s2s_tools {

namespace {

// Whether a process that has not yet ended is in process group `pgid` (a
// zombie waiting for its parent to reap it has ended).
bool GroupRuns(pid_t pgid) {
  std::error_code ec;
  for (const auto& e : std::filesystem::directory_iterator("/proc", ec)) {
    const std::string name = e.path().filename().string();
    if (name.find_first_not_of("0123456789") != std::string::npos) continue;
    std::ifstream in(e.path() / "stat");
    std::string stat((std::istreambuf_iterator<char>(in)), {});
    size_t paren = stat.rfind(')');
    if (paren == std::string::npos) continue;
    // After the name: the state, the parent and the process group.
    std::istringstream fields(stat.substr(paren + 2));
    char state = 0;
    long parent = 0, group = 0;
    if (fields >> state >> parent >> group && group == pgid && state != 'Z') {
      return true;
    }
  }
  return false;
}

const int kStartAttempts = 5;
const int kStartWaitMs = 5000;
const int kStopWaitMs = 10000;

void SleepMs(int ms) {
  timespec ts = {ms / 1000, (ms % 1000) * 1000000L};
  nanosleep(&ts, nullptr);
}

std::string ReadText(const std::string& path) {
  std::ifstream in(path);
  std::stringstream ss;
  ss << in.rdbuf();
  return ss.str();
}

bool WriteText(const std::string& path, const std::string& text) {
  std::string tmp = path + ".tmp";
  {
    std::ofstream out(tmp, std::ios::trunc);
    out << text;
    if (!out.flush()) return false;
  }
  return rename(tmp.c_str(), path.c_str()) == 0;
}

bool ParseAddress(const std::string& address, int port, sockaddr_in& sa) {
  memset(&sa, 0, sizeof sa);
  sa.sin_family = AF_INET;
  sa.sin_port = htons(static_cast<uint16_t>(port));
  return inet_pton(AF_INET, address.c_str(), &sa.sin_addr) == 1;
}

// A port on `address` that was free a moment ago, or -1.
int FreePort(const std::string& address) {
  sockaddr_in sa;
  if (!ParseAddress(address, 0, sa)) return -1;
  int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) return -1;
  socklen_t len = sizeof sa;
  int port = -1;
  if (bind(fd, reinterpret_cast<sockaddr*>(&sa), sizeof sa) == 0 &&
      getsockname(fd, reinterpret_cast<sockaddr*>(&sa), &len) == 0) {
    port = ntohs(sa.sin_port);
  }
  close(fd);
  return port;
}

bool Accepts(const std::string& address, int port) {
  sockaddr_in sa;
  if (!ParseAddress(address, port, sa)) return false;
  int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) return false;
  bool ok = connect(fd, reinterpret_cast<sockaddr*>(&sa), sizeof sa) == 0;
  close(fd);
  return ok;
}

// Whether `pid` is the rsync daemon of this root's configuration: a pid
// file can outlive its process and the number be reused by another.
bool IsOurDaemon(pid_t pid) {
  std::string cmdline =
      ReadText("/proc/" + std::to_string(static_cast<long>(pid)) + "/cmdline");
  std::string want = "--config=" + S2S::server::DaemonConfigPath();
  bool config = false;
  bool daemon = false;
  for (size_t start = 0; start < cmdline.size();) {
    size_t end = cmdline.find('\0', start);
    if (end == std::string::npos) end = cmdline.size();
    std::string arg = cmdline.substr(start, end - start);
    config = config || arg == want;
    daemon = daemon || arg == "--daemon";
    start = end + 1;
  }
  return config && daemon;
}

// The child: a session of its own, output to the log, nothing else open.
[[noreturn]] void ExecDaemon(const std::string& address, int port) {
  setsid();
  int null = open("/dev/null", O_RDONLY);
  int log = open(ServerLogPath().c_str(), O_WRONLY | O_CREAT | O_APPEND, 0600);
  if (null >= 0) dup2(null, 0);
  if (log >= 0) {
    dup2(log, 1);
    dup2(log, 2);
  }
  for (int fd = 3; fd < 1024; ++fd) close(fd);
  std::string port_arg = "--port=" + std::to_string(port);
  std::string address_arg = "--address=" + address;
  std::string config_arg = "--config=" + S2S::server::DaemonConfigPath();
  std::string log_arg = "--log-file=" + ServerLogPath();
  // The handler is the shell of the daemon's hooks: it runs a hook line of
  // its own configuration without a shell in between, and any other
  // through /bin/sh.
  std::string handler = DefaultHandler();
  if (!handler.empty() && access(handler.c_str(), X_OK) == 0) {
    setenv("RSYNC_SHELL", handler.c_str(), 1);
  }
  execlp("rsync", "rsync", "--daemon", "--no-detach", address_arg.c_str(),
         port_arg.c_str(), config_arg.c_str(), log_arg.c_str(),
         static_cast<char*>(nullptr));
  _exit(127);
}

}  // namespace

std::string ServerPidPath() { return KaroRootPath("/var/run/s2s-rsyncd.pid"); }
std::string ServerPortPath() {
  return KaroRootPath("/var/run/s2s-rsyncd.port");
}
std::string ServerLogPath() { return KaroRootPath("/var/log/s2s/rsyncd.log"); }

bool ServerDaemonRunning(pid_t& pid, int& port) {
  pid = KaroReadPidFile(ServerPidPath().c_str());
  if (pid <= 0 || KLIBCProcAliveByPidFile(ServerPidPath().c_str()) != 1 ||
      !IsOurDaemon(pid)) {
    return false;
  }
  port = atoi(ReadText(ServerPortPath()).c_str());
  return true;
}

bool StartServerDaemon(const std::string& address, int port, pid_t& pid,
                       int& port_out, std::string& error) {
  int running_port = 0;
  if (ServerDaemonRunning(pid, running_port)) {
    error = "the daemon already runs (pid " + std::to_string(pid) + ", port " +
            std::to_string(running_port) + ")";
    return false;
  }
  if (access(S2S::server::DaemonConfigPath().c_str(), R_OK) != 0) {
    error = "no daemon configuration; run 's2s-server config' first";
    return false;
  }
  // A configuration written by an earlier version gets this version's hooks.
  if (RegenerateServerConfig(error) < 0) return false;
  sockaddr_in sa;
  if (!ParseAddress(address, 0, sa)) {
    error = "not an IPv4 address: " + address;
    return false;
  }
  for (int attempt = 0; attempt < kStartAttempts; ++attempt) {
    // A free port may be taken between the probe and the daemon's bind.
    int p = port != 0 ? port : FreePort(address);
    if (p <= 0) break;
    pid_t child = fork();
    if (child < 0) break;
    if (child == 0) ExecDaemon(address, p);
    for (int waited = 0; waited < kStartWaitMs; waited += 10) {
      if (Accepts(address, p)) {
        if (!WriteText(ServerPidPath(), std::to_string(child) + "\n") ||
            !WriteText(ServerPortPath(), std::to_string(p) + "\n")) {
          kill(child, SIGTERM);
          error = "cannot write " + ServerPidPath();
          return false;
        }
        pid = child;
        port_out = p;
        return true;
      }
      if (waitpid(child, nullptr, WNOHANG) == child) break;
      SleepMs(10);
    }
    if (waitpid(child, nullptr, WNOHANG) == 0) {
      kill(child, SIGKILL);
      waitpid(child, nullptr, 0);
    }
    if (port != 0) break;
  }
  error = "the daemon did not start; see " + ServerLogPath();
  return false;
}

int StopServerDaemon(std::string& error) {
  std::string pid_path = ServerPidPath();
  pid_t pid = KaroReadPidFile(pid_path.c_str());
  if (pid <= 0 || KLIBCProcAliveByPidFile(pid_path.c_str()) != 1) {
    unlink(pid_path.c_str());
    unlink(ServerPortPath().c_str());
    return 0;
  }
  if (!IsOurDaemon(pid)) {
    // The files stay: they may be all that points at a daemon that still
    // serves, and removing them would make status report it stopped.
    error = "pid " + std::to_string(pid) + " of " + pid_path +
            " is not this root's rsync daemon; not signalled, pid file kept";
    return -1;
  }
  // A daemon that leads its process group (as ExecDaemon starts it) has its
  // connections, and the transfers they run, in that group: they end too.
  pid_t target = getpgid(pid) == pid ? -pid : pid;
  if (kill(target, SIGTERM) != 0) {
    error = "cannot signal pid " + std::to_string(pid) + ": " + strerror(errno);
    return -1;
  }
  for (int waited = 0;
       target < 0 ? GroupRuns(pid)
                  : KLIBCProcAliveByPidFile(pid_path.c_str()) == 1;
       waited += 10) {
    if (waited == kStopWaitMs) kill(target, SIGKILL);
    if (waited > 2 * kStopWaitMs) {
      error = "pid " + std::to_string(pid) + " or its connections do not end";
      return -1;
    }
    SleepMs(10);
    // Reaps it when this process started it (tests, the benchmark).
    waitpid(pid, nullptr, WNOHANG);
  }
  unlink(pid_path.c_str());
  unlink(ServerPortPath().c_str());
  return 1;
}

}  // namespace s2s_tools
