#include "service/control_server.h"

#include <errno.h>
#include <poll.h>
#include <string.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <time.h>
#include <unistd.h>

#include "S2S/logger.h"
#include "service/wire_reader.h"

namespace s2s_service {

namespace {

using S2S::PObject;

// Decoding stops here; the protocol's own, smaller, limit is checked on
// the decoded request.
const unsigned int kWireDepth = 512;

long long NowMs() {
  timespec ts;
  clock_gettime(CLOCK_MONOTONIC, &ts);
  return ts.tv_sec * 1000LL + ts.tv_nsec / 1000000;
}

void SendReply(int fd, const PObject& reply) {
  S2S::IPCSender sender;
  if (sender.assign(fd) != 0) {
    close(fd);
    return;
  }
  sender.channel().SetTimeout(ControlServer::kRequestSeconds);
  PObject none;
  sender.send(reply, false, none);
  sender.close();
}

}  // namespace

PObject MakeReply(unsigned int result, const std::string& message) {
  PObject reply;
  reply = PObject::Map();
  reply["result"] = result;
  reply["message"] = message.substr(0, ControlServer::kMaxMessage);
  return reply;
}

ControlServer::~ControlServer() { Stop(); }

bool ControlServer::Start(const std::string& path, bool has_admin_group,
                          gid_t admin_gid, Handler handler,
                          std::string& error) {
  handler_ = std::move(handler);
  has_admin_group_ = has_admin_group;
  admin_gid_ = admin_gid;
  // The socket is made private before anyone can connect to it.
  mode_t old = umask(0177);
  int rc = listener_.prepare(path);
  umask(old);
  if (rc != 0) {
    error = "cannot listen on " + path;
    return false;
  }
  if (has_admin_group &&
      (chown(path.c_str(), static_cast<uid_t>(-1), admin_gid) != 0 ||
       chmod(path.c_str(), 0660) != 0)) {
    error = "cannot give " + path + " to the admin group: " + strerror(errno);
    listener_.close();
    return false;
  }
  stop_fd_ = eventfd(0, EFD_CLOEXEC);
  if (stop_fd_ < 0) {
    error = std::string("eventfd: ") + strerror(errno);
    listener_.close();
    return false;
  }
  thread_ = std::thread([this] { Serve(); });
  return true;
}

void ControlServer::Stop() {
  if (thread_.joinable()) {
    uint64_t one = 1;
    if (write(stop_fd_, &one, sizeof one) < 0) {
      // The thread is woken by the eventfd only; without it, it would wait.
      S2S::Logger::LogMsg(S2S::Logger::Error,
                          "[ERROR] control: cannot stop: %s\n",
                          strerror(errno));
    }
    thread_.join();
  }
  if (stop_fd_ >= 0) {
    close(stop_fd_);
    stop_fd_ = -1;
  }
  listener_.close();
}

bool ControlServer::Permitted(int fd) const {
  ucred cred;
  socklen_t len = sizeof cred;
  if (getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &cred, &len) != 0) return false;
  return cred.uid == 0 || cred.uid == geteuid() ||
         (has_admin_group_ && cred.gid == admin_gid_);
}

void ControlServer::Serve() {
  pollfd fds[2] = {{listener_.getFD(), POLLIN, 0}, {stop_fd_, POLLIN, 0}};
  for (;;) {
    if (poll(fds, 2, -1) < 0) {
      if (errno == EINTR) continue;
      S2S::Logger::LogMsg(S2S::Logger::Error, "[ERROR] control: poll: %s\n",
                          strerror(errno));
      return;
    }
    if (fds[1].revents != 0) return;
    if (fds[0].revents == 0) continue;
    int fd = accept4(listener_.getFD(), nullptr, nullptr,
                     SOCK_CLOEXEC | SOCK_NONBLOCK);
    if (fd >= 0) Connection(fd);
  }
}

void ControlServer::Connection(int fd) {
  // A refused peer's request is read all the same, so that the reply is
  // not lost to a connection reset over unread bytes.
  bool permitted = Permitted(fd);
  std::string data;
  PObject request;
  long long deadline = NowMs() + kRequestSeconds * 1000LL;
  char buf[65536];
  for (;;) {
    size_t used = 0;
    int rc = data.empty() ? 0
                          : DecodeMessage(data.data(), data.size(), kWireDepth,
                                          request, used);
    if (rc == 1) break;
    if (rc < 0) {
      S2S::Logger::LogMsg(S2S::Logger::Warning,
                          "[WARNING] control: a request that is no message "
                          "was dropped\n");
      close(fd);
      return;
    }
    if (data.size() > kMaxRequest) {
      SendReply(fd, MakeReply(kResultMalformed, "the request is too large"));
      return;
    }
    long long left = deadline - NowMs();
    pollfd p = {fd, POLLIN, 0};
    int ready = left > 0 ? poll(&p, 1, static_cast<int>(left)) : 0;
    if (ready < 0 && errno == EINTR) continue;
    ssize_t n = -1;
    if (ready > 0) {
      n = read(fd, buf, sizeof buf);
      if (n < 0 && (errno == EAGAIN || errno == EINTR)) continue;
    }
    if (n <= 0) {
      // The peer went away, failed, or was too slow: nothing to answer.
      close(fd);
      return;
    }
    data.append(buf, static_cast<size_t>(n));
  }
  if (!permitted) {
    S2S::Logger::LogMsg(S2S::Logger::Warning,
                        "[WARNING] control: a peer that is not permitted was "
                        "refused\n");
    SendReply(fd, MakeReply(kResultNotPermitted,
                            "not permitted: only root, the service's user or "
                            "the admin group"));
    return;
  }
  SendReply(fd, handler_(request));
}

}  // namespace s2s_service
