#include "testutil.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <poll.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/sem.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <mutex>
#include <sstream>
#include <thread>

#include "S2S/is_syncedshare_detail.h"
#include "S2S/syslog_sink.h"
#include "gtest/gtest.h"

namespace s2s_test {

namespace {

std::string TempBase() {
  const char* t = getenv("TMPDIR");
  return (t != nullptr && *t != '\0') ? t : "/tmp";
}

// In a forked child: applies `env` (as Spawn), puts `in`, `out` and `err`
// (-1: inherited) on 0, 1 and 2 and runs `args`.
[[noreturn]] void ExecChild(std::vector<std::string> args, int in, int out,
                            int err, const std::vector<std::string>& env) {
  for (const std::string& e : env) {
    if (e.find('=') == std::string::npos) {
      unsetenv(e.c_str());
    } else {
      putenv(strdup(e.c_str()));
    }
  }
  const int fds[] = {in, out, err};
  for (int i = 0; i < 3; ++i)
    if (fds[i] >= 0) dup2(fds[i], i);
  std::vector<char*> argv;
  for (std::string& a : args) argv.push_back(&a[0]);
  argv.push_back(nullptr);
  execvp(argv[0], argv.data());
  _exit(127);
}

std::mutex syslog_mutex;
std::vector<std::string> syslog_messages;
std::vector<int> syslog_priorities;

sockaddr_in LoopbackAddr(int port) {
  sockaddr_in addr{};
  addr.sin_family = AF_INET;
  addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  addr.sin_port = htons(static_cast<uint16_t>(port));
  return addr;
}

bool Accepts(int port) {
  int fd = ConnectLoopback(port);
  if (fd >= 0) close(fd);
  return fd >= 0;
}

// A root's registry lock outlives its files (a System V semaphore): the
// locks of the directory and of the roots directly inside it go with it.
void RemoveRegistryLocks(const std::string& dir) {
  std::vector<std::string> roots = {dir};
  std::error_code ec;
  for (const auto& e : std::filesystem::directory_iterator(dir, ec)) {
    if (e.is_directory(ec)) roots.push_back(e.path().string());
  }
  for (const std::string& root : roots) {
    int id = semget(S2S::detail::RegistrySemKeyFor(root), 1, 0);
    if (id >= 0) semctl(id, 0, IPC_RMID);
  }
}

void RecordSyslog(int priority, const char* format, va_list ap) {
  char buf[8192];
  vsnprintf(buf, sizeof buf, format, ap);
  std::lock_guard<std::mutex> lock(syslog_mutex);
  syslog_messages.push_back(buf);
  syslog_priorities.push_back(priority);
}

}  // namespace

pid_t Exec(std::vector<std::string> args, int in, int out) {
  pid_t pid = fork();
  if (pid == 0) ExecChild(std::move(args), in, out, out, {});
  return pid;
}

int ConnectLoopback(int port) {
  int fd = socket(AF_INET, SOCK_STREAM, 0);
  sockaddr_in addr = LoopbackAddr(port);
  if (fd >= 0 &&
      connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) != 0) {
    close(fd);
    fd = -1;
  }
  return fd;
}

void StopChild(pid_t* pid) {
  if (*pid <= 0) return;
  kill(*pid, SIGTERM);
  waitpid(*pid, nullptr, 0);
  *pid = -1;
}

pid_t SpawnListening(
    const std::function<std::vector<std::string>(int)>& argv_for,
    const std::string& log, int* port) {
  for (int attempt = 0; attempt < 5; ++attempt) {
    *port = FreeLoopbackPort();
    std::vector<std::string> args = argv_for(*port);
    if (args.empty()) return -1;
    int fd = open(log.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0600);
    pid_t pid = Exec(args, -1, fd);
    if (fd >= 0) close(fd);
    if (pid < 0) return -1;
    bool exited = false;
    if (WaitUntil(
            [&] {
              exited = waitpid(pid, nullptr, WNOHANG) == pid;
              return exited || Accepts(*port);
            },
            5) &&
        !exited) {
      return pid;
    }
    if (!exited) {  // a reaped pid may be someone else's by now
      kill(pid, SIGKILL);
      waitpid(pid, nullptr, 0);
    }
  }
  *port = -1;
  return -1;
}

int Child::Wait(int seconds) {
  int pid_fd = static_cast<int>(syscall(SYS_pidfd_open, pid, 0));
  pollfd exited = {pid_fd, POLLIN, 0};
  if (pid_fd < 0 || poll(&exited, 1, seconds * 1000) != 1) {
    ADD_FAILURE() << "still running after " << seconds << " s";
    kill(pid, SIGKILL);
  }
  if (pid_fd >= 0) close(pid_fd);
  int st = 0;
  waitpid(pid, &st, 0);
  code = WIFEXITED(st) ? WEXITSTATUS(st) : 128 + WTERMSIG(st);
  out = ReadFile(out_path);
  err = ReadFile(err_path);
  return code;
}

Child Spawn(const std::string& dir, const std::vector<std::string>& argv,
            const std::vector<std::string>& env) {
  static int serial = 0;
  Child c;
  c.out_path = dir + "/out." + std::to_string(++serial);
  c.err_path = dir + "/err." + std::to_string(serial);
  c.pid = fork();
  if (c.pid == 0) {
    ExecChild(
        argv, -1, open(c.out_path.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600),
        open(c.err_path.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600), env);
  }
  return c;
}

Child RunProgram(const std::string& dir, const std::vector<std::string>& argv,
                 const std::vector<std::string>& env) {
  Child c = Spawn(dir, argv, env);
  c.Wait();
  return c;
}

std::vector<int> RunInChildren(int n, const std::function<int(int)>& child) {
  int go[2];
  if (pipe(go) != 0) return {};
  std::vector<pid_t> pids;
  for (int i = 0; i < n; ++i) {
    pids.push_back(fork());
    char c;
    if (pids.back() == 0)
      _exit(close(go[1]) == 0 && read(go[0], &c, 1) == 0 ? child(i) : 126);
  }
  close(go[0]);
  close(go[1]);  // all start at once
  std::vector<int> codes;
  for (pid_t pid : pids) {
    int st = 0;
    bool reaped = pid > 0 && waitpid(pid, &st, 0) == pid;
    codes.push_back(reaped && WIFEXITED(st) ? WEXITSTATUS(st) : -1);
  }
  return codes;
}

bool WaitUntil(const std::function<bool()>& done, double seconds,
               double every) {
  auto start = std::chrono::steady_clock::now();
  while (!done()) {
    if (SecondsSince(start) > seconds) return false;
    std::this_thread::sleep_for(std::chrono::duration<double>(every));
  }
  return true;
}

TempDir::TempDir() {
  std::string tmpl = TempBase() + "/s2s-test.XXXXXX";
  char* made = mkdtemp(&tmpl[0]);
  if (made == nullptr) abort();
  path_ = made;
}

TempDir::~TempDir() {
  RemoveRegistryLocks(path_);
  std::error_code ec;
  std::filesystem::remove_all(path_, ec);
}

TempRoot::TempRoot() : env_("S2S_ROOT", path()) {}

bool TempRoot::MakeDir(const std::string& abs) const {
  std::error_code ec;
  std::filesystem::create_directories(Path(abs), ec);
  return !ec;
}

bool TempRoot::Write(const std::string& abs, const std::string& data) const {
  return MakeDir(abs.substr(0, abs.rfind('/'))) && WriteFile(Path(abs), data);
}

SyslogCapture::SyslogCapture() {
  Clear();
  S2S::detail::SetSyslogWriter(&RecordSyslog);
}

SyslogCapture::~SyslogCapture() { S2S::detail::SetSyslogWriter(nullptr); }

std::vector<std::string> SyslogCapture::Messages() const {
  std::lock_guard<std::mutex> lock(syslog_mutex);
  return syslog_messages;
}

std::vector<int> SyslogCapture::Priorities() const {
  std::lock_guard<std::mutex> lock(syslog_mutex);
  return syslog_priorities;
}

std::string SyslogCapture::Text() const {
  std::string all;
  for (const std::string& m : Messages()) all += m;
  return all;
}

void SyslogCapture::Clear() {
  std::lock_guard<std::mutex> lock(syslog_mutex);
  syslog_messages.clear();
  syslog_priorities.clear();
}

bool UnixSocketPair(int fds[2]) {
  return socketpair(AF_UNIX, SOCK_STREAM, 0, fds) == 0;
}

bool TcpSocketPair(int fds[2]) {
  int port = 0;
  int lfd = LoopbackListener(&port);
  if (lfd < 0) return false;
  fds[0] = ConnectLoopback(port);
  fds[1] = fds[0] >= 0 ? accept(lfd, nullptr, nullptr) : -1;
  close(lfd);
  if (fds[1] < 0 && fds[0] >= 0) close(fds[0]);
  return fds[1] >= 0;
}

ChannelPair::ChannelPair(unsigned int capacity, bool tcp)
    : a(capacity), b(capacity) {
  int fds[2];
  ok = (tcp ? TcpSocketPair(fds) : UnixSocketPair(fds)) &&
       a.Open(fds[0], true) == 0;
  EXPECT_TRUE(ok);
  peer = fds[1];
}

ChannelPair::~ChannelPair() {
  if (b.IsClosed() && peer >= 0) close(peer);
}

std::string ChannelPair::Pending() {
  char buf[4096];
  ssize_t n = recv(peer, buf, sizeof buf, MSG_DONTWAIT);
  return n > 0 ? std::string(buf, n) : std::string();
}

int LoopbackListener(int* port) {
  int fd = socket(AF_INET, SOCK_STREAM, 0);
  if (fd < 0) return -1;
  sockaddr_in addr = LoopbackAddr(*port);
  socklen_t len = sizeof addr;
  if (bind(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) != 0 ||
      listen(fd, 8) != 0 ||
      getsockname(fd, reinterpret_cast<sockaddr*>(&addr), &len) != 0) {
    close(fd);
    return -1;
  }
  *port = ntohs(addr.sin_port);
  return fd;
}

// Through operator<<, which keeps what a read error (a gone /proc file) cut.
std::string ReadFile(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  std::ostringstream out;
  if (in) out << in.rdbuf();
  return out.str();
}

bool WriteFile(const std::string& path, const std::string& data, int mode) {
  std::ofstream out(path, std::ios::binary | std::ios::trunc);
  out << data;
  out.close();
  return out && (mode == -1 || chmod(path.c_str(), mode) == 0);
}

void ExpectHas(const std::string& text,
               std::initializer_list<std::string> parts) {
  for (const std::string& p : parts)
    EXPECT_TRUE(Has(text, p)) << p << "\n" << text;
}

int Mode(const std::string& path) {
  struct stat st;
  return stat(path.c_str(), &st) == 0 ? st.st_mode & 07777 : -1;
}

int FreeLoopbackPort() {
  int port = 0, fd = LoopbackListener(&port);
  if (fd >= 0) close(fd);
  return fd >= 0 ? port : -1;
}

bool RsyncDaemon::StartWithConfig(const std::string& conf) {
  Stop();
  std::string log = dir_ + "/rsyncd.log";
  pid_ = SpawnListening(
      [&](int port) -> std::vector<std::string> {
        return std::vector<std::string>({"rsync", "--daemon", "--no-detach",
                                         "--address=127.0.0.1", "--port",
                                         std::to_string(port), "--config", conf,
                                         "--log-file", log});
      },
      log, &port_);
  return pid_ > 0;
}

void RsyncDaemon::Stop() {
  StopChild(&pid_);
  port_ = -1;
}

std::string RsyncDaemon::Log() const { return ReadFile(dir_ + "/rsyncd.log"); }

ScopedEnv::ScopedEnv(const std::string& name, const std::string& value)
    : name_(name) {
  const char* old = getenv(name.c_str());
  had_ = old != nullptr;
  if (had_) old_ = old;
  setenv(name.c_str(), value.c_str(), 1);
  tzset();
}

ScopedEnv::~ScopedEnv() {
  if (had_) {
    setenv(name_.c_str(), old_.c_str(), 1);
  } else {
    unsetenv(name_.c_str());
  }
  tzset();
}

Hash MakeHash(std::initializer_list<std::pair<const char*, const char*>> kv) {
  Hash h(KLIBCSzHashAlloc(64), &KLIBCSzHashFree);
  for (const auto& p : kv) KLIBCSzHashSetValue(h.get(), p.first, p.second);
  return h;
}

std::string RegistryValue(const std::string& section, const std::string& key) {
  Hash h = MakeHash();
  const char* v = S2SGetServerInfo(section.c_str(), h.get()) == 1
                      ? KLIBCSzHashGetValue(h.get(), key.c_str())
                      : nullptr;
  return v != nullptr ? v : "";
}

bool RunQuiet(const std::vector<std::string>& args) {
  int fd = open("/dev/null", O_RDWR | O_CLOEXEC);
  pid_t pid = Exec(args, fd, fd);
  close(fd);
  int status = 0;
  return pid > 0 && waitpid(pid, &status, 0) == pid && WIFEXITED(status) &&
         WEXITSTATUS(status) == 0;
}

}  // namespace s2s_test
