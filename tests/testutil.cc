#include "testutil.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/socket.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <mutex>
#include <sstream>

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

}  // namespace s2s_test
