#include "testutil.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <poll.h>
#include <signal.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <mutex>
#include <sstream>

#include "S2S/logger.h"
#include "S2S/syslog_sink.h"

namespace s2s_test {

namespace {

std::string TempBase() {
  const char* t = getenv("TMPDIR");
  return (t != nullptr && *t != '\0') ? t : "/tmp";
}

std::mutex syslog_mutex;
std::vector<std::string> syslog_messages;
std::vector<int> syslog_priorities;

bool Accepts(int port) {
  int fd = socket(AF_INET, SOCK_STREAM, 0);
  if (fd < 0) return false;
  sockaddr_in addr{};
  addr.sin_family = AF_INET;
  addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  addr.sin_port = htons(static_cast<uint16_t>(port));
  bool ok = connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) == 0;
  close(fd);
  return ok;
}

void RecordSyslog(int priority, const char* format, va_list ap) {
  char buf[8192];
  vsnprintf(buf, sizeof buf, format, ap);
  std::lock_guard<std::mutex> lock(syslog_mutex);
  syslog_messages.push_back(buf);
  syslog_priorities.push_back(priority);
}

}  // namespace

TempDir::TempDir() {
  std::string tmpl = TempBase() + "/s2s-test.XXXXXX";
  char* made = mkdtemp(&tmpl[0]);
  if (made == nullptr) abort();
  path_ = made;
}

TempDir::~TempDir() {
  std::error_code ec;
  std::filesystem::remove_all(path_, ec);
}

std::string TempDir::Sub(const std::string& name) const {
  return path_ + "/" + name;
}

TempRoot::TempRoot() : env_("S2S_ROOT", path()) {}

std::string TempRoot::Path(const std::string& abs) const {
  return path() + abs;
}

bool TempRoot::MakeDir(const std::string& abs) const {
  std::error_code ec;
  std::filesystem::create_directories(Path(abs), ec);
  return !ec;
}

bool TempRoot::Write(const std::string& abs, const std::string& data) const {
  return MakeDir(abs.substr(0, abs.rfind('/'))) && WriteFile(Path(abs), data);
}

bool WriteScript(const std::string& path, const std::string& body) {
  return WriteFile(path, "#!/bin/sh\n" + body) &&
         chmod(path.c_str(), 0755) == 0;
}

CaptureFd::CaptureFd(int fd) : fd_(fd) {
  fflush(nullptr);
  file_ = TempBase() + "/s2s-capture.XXXXXX";
  int tmp = mkstemp(&file_[0]);
  if (tmp < 0) abort();
  saved_ = dup(fd_);
  dup2(tmp, fd_);
  close(tmp);
}

CaptureFd::~CaptureFd() {
  fflush(nullptr);
  dup2(saved_, fd_);
  close(saved_);
  unlink(file_.c_str());
}

std::string CaptureFd::Text() {
  fflush(nullptr);
  return ReadFile(file_);
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

LogCapture::LogCapture(int level) {
  S2S::Logger::Initialize(S2S::Logger::Syslog, level, "", 0);
}

LogCapture::~LogCapture() {
  S2S::Logger::Initialize(S2S::Logger::Syslog, S2S::Logger::Error, "", 0);
}

bool UnixSocketPair(int fds[2]) {
  return socketpair(AF_UNIX, SOCK_STREAM, 0, fds) == 0;
}

bool TcpSocketPair(int fds[2]) {
  int lfd = socket(AF_INET, SOCK_STREAM, 0);
  if (lfd < 0) return false;
  sockaddr_in addr{};
  addr.sin_family = AF_INET;
  addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  socklen_t len = sizeof addr;
  bool ok = bind(lfd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) == 0 &&
            listen(lfd, 1) == 0 &&
            getsockname(lfd, reinterpret_cast<sockaddr*>(&addr), &len) == 0;
  fds[0] = fds[1] = -1;
  if (ok) {
    fds[0] = socket(AF_INET, SOCK_STREAM, 0);
    ok = fds[0] >= 0 &&
         connect(fds[0], reinterpret_cast<sockaddr*>(&addr), sizeof addr) == 0;
  }
  if (ok) {
    fds[1] = accept(lfd, nullptr, nullptr);
    ok = fds[1] >= 0;
  }
  close(lfd);
  if (!ok) {
    if (fds[0] >= 0) close(fds[0]);
    if (fds[1] >= 0) close(fds[1]);
  }
  return ok;
}

std::string ReadFile(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  if (!in) return std::string();
  std::ostringstream out;
  out << in.rdbuf();
  return out.str();
}

bool WriteFile(const std::string& path, const std::string& data) {
  std::ofstream out(path, std::ios::binary | std::ios::trunc);
  out << data;
  return static_cast<bool>(out);
}

int FreeLoopbackPort() {
  int fd = socket(AF_INET, SOCK_STREAM, 0);
  if (fd < 0) return -1;
  sockaddr_in addr{};
  addr.sin_family = AF_INET;
  addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  addr.sin_port = 0;
  socklen_t len = sizeof addr;
  int port = -1;
  if (bind(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) == 0 &&
      getsockname(fd, reinterpret_cast<sockaddr*>(&addr), &len) == 0) {
    port = ntohs(addr.sin_port);
  }
  close(fd);
  return port;
}

RsyncDaemon::RsyncDaemon(const std::string& dir) : dir_(dir) {}

RsyncDaemon::~RsyncDaemon() { Stop(); }

bool RsyncDaemon::Start(const std::vector<RsyncModule>& modules,
                        const std::string& user, const std::string& password) {
  std::string secrets = dir_ + "/rsyncd.secrets";
  if (!WriteFile(secrets, user + ":" + password + "\n") ||
      chmod(secrets.c_str(), 0600) != 0) {
    return false;
  }
  std::string conf = "use chroot = no\nsocket options = TCP_NODELAY\n";
  conf += "uid = " + std::to_string(geteuid()) + "\n";
  conf += "gid = " + std::to_string(getegid()) + "\n";
  for (const RsyncModule& m : modules) {
    conf += "[" + m.name + "]\n\tpath = " + m.path + "\n";
    conf += "\tauth users = " + user + "\n\tsecrets file = " + secrets + "\n";
    for (const std::string& line : m.extra) conf += "\t" + line + "\n";
  }
  std::string conf_path = dir_ + "/rsyncd.conf";
  return WriteFile(conf_path, conf) && StartWithConfig(conf_path);
}

bool RsyncDaemon::StartWithConfig(const std::string& conf) {
  Stop();
  std::string log = dir_ + "/rsyncd.log";
  // The free port may be taken between the probe and the daemon's bind.
  for (int attempt = 0; attempt < 5; ++attempt) {
    int port = FreeLoopbackPort();
    std::string port_arg = "--port=" + std::to_string(port);
    std::string conf_arg = "--config=" + conf;
    std::string log_arg = "--log-file=" + log;
    pid_t pid = fork();
    if (pid < 0) return false;
    if (pid == 0) {
      int fd = open(log.c_str(), O_WRONLY | O_CREAT | O_APPEND, 0600);
      if (fd >= 0) {
        dup2(fd, 1);
        dup2(fd, 2);
      }
      execlp("rsync", "rsync", "--daemon", "--no-detach", "--address=127.0.0.1",
             port_arg.c_str(), conf_arg.c_str(), log_arg.c_str(),
             static_cast<char*>(nullptr));
      _exit(127);
    }
    for (int waited = 0; waited < 5000; waited += 5) {
      if (Accepts(port)) {
        pid_ = pid;
        port_ = port;
        return true;
      }
      if (waitpid(pid, nullptr, WNOHANG) == pid) break;
      timespec ts = {0, 5 * 1000 * 1000};
      nanosleep(&ts, nullptr);
    }
    kill(pid, SIGKILL);
    waitpid(pid, nullptr, 0);
  }
  return false;
}

void RsyncDaemon::Stop() {
  if (pid_ <= 0) return;
  kill(pid_, SIGTERM);
  waitpid(pid_, nullptr, 0);
  pid_ = -1;
  port_ = -1;
}

std::string RsyncDaemon::Log() const { return ReadFile(dir_ + "/rsyncd.log"); }

ScopedEnv::ScopedEnv(const std::string& name, const std::string& value)
    : name_(name) {
  const char* old = getenv(name.c_str());
  had_ = old != nullptr;
  if (had_) old_ = old;
  setenv(name.c_str(), value.c_str(), 1);
}

ScopedEnv::~ScopedEnv() {
  if (had_) {
    setenv(name_.c_str(), old_.c_str(), 1);
  } else {
    unsetenv(name_.c_str());
  }
}

ScopedTZ::ScopedTZ(const std::string& tz) : env_(new ScopedEnv("TZ", tz)) {
  tzset();
}

ScopedTZ::~ScopedTZ() {
  env_.reset();
  tzset();
}

bool RunQuiet(const std::vector<std::string>& args) {
  pid_t pid = fork();
  if (pid < 0) return false;
  if (pid == 0) {
    int fd = open("/dev/null", O_RDWR);
    dup2(fd, 0);
    dup2(fd, 1);
    dup2(fd, 2);
    std::vector<char*> argv;
    for (const std::string& a : args)
      argv.push_back(const_cast<char*>(a.c_str()));
    argv.push_back(nullptr);
    execvp(argv[0], argv.data());
    _exit(127);
  }
  int status = 0;
  waitpid(pid, &status, 0);
  return WIFEXITED(status) && WEXITSTATUS(status) == 0;
}

PipedProcess::~PipedProcess() { Stop(); }

bool PipedProcess::Start(std::vector<std::string> args) {
  Stop();
  int in[2], out[2];
  if (pipe(in) != 0) return false;
  if (pipe(out) != 0) {
    close(in[0]);
    close(in[1]);
    return false;
  }
  pid_ = fork();
  if (pid_ == 0) {
    dup2(in[0], 0);
    dup2(out[1], 1);
    dup2(out[1], 2);
    close(in[1]);
    close(out[0]);
    std::vector<char*> argv;
    for (std::string& a : args) argv.push_back(&a[0]);
    argv.push_back(nullptr);
    execvp(argv[0], argv.data());
    _exit(127);
  }
  close(in[0]);
  close(out[1]);
  in_ = in[1];
  out_ = out[0];
  output_.clear();
  return pid_ > 0;
}

bool PipedProcess::WaitFor(const std::string& text, double seconds) {
  auto deadline = std::chrono::steady_clock::now() +
                  std::chrono::milliseconds(static_cast<int>(seconds * 1000));
  while (output_.find(text) == std::string::npos) {
    auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
                    deadline - std::chrono::steady_clock::now())
                    .count();
    pollfd p = {out_, POLLIN, 0};
    if (left <= 0 || poll(&p, 1, static_cast<int>(left)) <= 0) return false;
    char buf[4096];
    ssize_t n = read(out_, buf, sizeof buf);
    if (n <= 0) return false;
    output_.append(buf, static_cast<size_t>(n));
  }
  return true;
}

bool PipedProcess::Send(const std::string& data) {
  return write(in_, data.data(), data.size()) ==
         static_cast<ssize_t>(data.size());
}

void PipedProcess::Stop() {
  if (pid_ > 0) {
    kill(pid_, SIGTERM);
    waitpid(pid_, nullptr, 0);
    pid_ = -1;
  }
  if (in_ >= 0) close(in_);
  if (out_ >= 0) close(out_);
  in_ = out_ = -1;
}

SshServer::SshServer(const std::string& dir) : dir_(dir) {}

SshServer::~SshServer() { Stop(); }

bool SshServer::Start(const std::string& forced_command,
                      const std::string& client_key,
                      const std::string& known_hosts) {
  std::string host_key = dir_ + "/ssh_host_key";
  std::filesystem::create_directories(
      std::filesystem::path(client_key).parent_path());
  if (!RunQuiet(
          {"ssh-keygen", "-q", "-t", "ed25519", "-N", "", "-f", host_key}) ||
      !RunQuiet(
          {"ssh-keygen", "-q", "-t", "ed25519", "-N", "", "-f", client_key})) {
    return false;
  }
  std::string authorized = dir_ + "/authorized_keys";
  if (!WriteFile(authorized, "command=\"" + forced_command +
                                 "\",no-pty,no-port-forwarding " +
                                 ReadFile(client_key + ".pub"))) {
    return false;
  }
  // sshd insists on its privilege separation directory.
  mkdir("/run/sshd", 0755);
  for (int attempt = 0; attempt < 5; ++attempt) {
    int port = FreeLoopbackPort();
    std::string conf = dir_ + "/sshd_config";
    WriteFile(conf, "Port " + std::to_string(port) +
                        "\nListenAddress 127.0.0.1\nHostKey " + host_key +
                        "\nAuthorizedKeysFile " + authorized +
                        "\nStrictModes no\nUsePAM no\nPasswordAuthentication no"
                        "\nKbdInteractiveAuthentication no"
                        "\nPermitRootLogin prohibit-password\nPidFile none\n");
    std::string log = dir_ + "/sshd.log";
    pid_t pid = fork();
    if (pid < 0) return false;
    if (pid == 0) {
      execl("/usr/sbin/sshd", "/usr/sbin/sshd", "-D", "-f", conf.c_str(), "-E",
            log.c_str(), static_cast<char*>(nullptr));
      _exit(127);
    }
    for (int waited = 0; waited < 5000; waited += 5) {
      if (Accepts(port)) {
        pid_ = pid;
        port_ = port;
        std::string pub = ReadFile(host_key + ".pub");
        return WriteFile(known_hosts,
                         "[127.0.0.1]:" + std::to_string(port) + " " + pub);
      }
      if (waitpid(pid, nullptr, WNOHANG) == pid) break;
      timespec ts = {0, 5 * 1000 * 1000};
      nanosleep(&ts, nullptr);
    }
    kill(pid, SIGKILL);
    waitpid(pid, nullptr, 0);
  }
  return false;
}

void SshServer::Stop() {
  if (pid_ <= 0) return;
  kill(pid_, SIGTERM);
  waitpid(pid_, nullptr, 0);
  pid_ = -1;
}

}  // namespace s2s_test
