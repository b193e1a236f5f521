// Local IPC: the listening end and the message end.
#include "S2S/ipc.h"

#include <arpa/inet.h>
#include <errno.h>
#include <netinet/in.h>
#include <stddef.h>
#include <string.h>
#include <sys/select.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include "S2S/stream.h"

#define S2S_LOG_AREA "ipc"
#include "S2S/log.h"

namespace S2S {

namespace {

// The IPC sender's ring size.
constexpr unsigned int kSenderCapacity = 0x14000;

// Logs a failed system call as "<call>: <text> (<errno>)".
void LogCallFailure(const char* call) {
  int e = errno;
  LOG_ERROR("%s: %s (%d)", call, strerror(e), e);
}

sockaddr_in LoopbackAddress(int port) {
  sockaddr_in addr;
  memset(&addr, 0, sizeof addr);
  addr.sin_family = AF_INET;
  addr.sin_addr.s_addr = inet_addr("127.0.0.1");
  addr.sin_port = htons(static_cast<uint16_t>(port));
  return addr;
}

bool FitsSocketAddress(const std::string& path) {
  return path.size() < sizeof(sockaddr_un::sun_path);
}

}  // namespace

// ---------------------------------------------------------------------------
// IPCListener.

IPCListener::IPCListener() : fd(-1) {
  timeout.tv_sec = 3;
  timeout.tv_usec = 0;
}

IPCListener::~IPCListener() { close(); }

int IPCListener::OpenDomainSocket(const std::string& path) {
  if (path.empty()) return -1;
  if (!FitsSocketAddress(path)) {
    LOG_ERROR("socket path too long (%zu bytes): '%s'", path.size(),
              path.c_str());
    return -1;
  }
  int s = socket(AF_UNIX, SOCK_STREAM, 0);
  if (s < 0) {
    LogCallFailure("socket");
    return -1;
  }
  unlink(path.c_str());
  sockaddr_un addr;
  memset(&addr, 0, sizeof addr);
  addr.sun_family = AF_UNIX;
  memcpy(addr.sun_path, path.data(), path.size());
  int on = 1;
  bool ok = false;
  if (setsockopt(s, SOL_SOCKET, SO_REUSEADDR, &on, sizeof on) != 0) {
    int e = errno;
    LOG_ERROR("Failed to setsockopt %s (%d)", strerror(e), e);
  } else if (bind(s, reinterpret_cast<sockaddr*>(&addr), sizeof addr) != 0) {
    LogCallFailure("bind");
  } else if (listen(s, 8) != 0) {
    LogCallFailure("listen");
  } else {
    ok = true;
  }
  if (!ok) {
    CloseDomainSocket(s);
    return -1;
  }
  LOG_DEBUG("listening on domain socket '%s'", path.c_str());
  return s;
}

int IPCListener::CloseDomainSocket(int s) {
  if (s < 0) return -1;
  sockaddr_un addr;
  memset(&addr, 0, sizeof addr);
  socklen_t len = sizeof addr;
  if (getsockname(s, reinterpret_cast<sockaddr*>(&addr), &len) != 0) {
    LogCallFailure("getsockname");
    CloseSocket(s);
    return 0;
  }
  CloseSocket(s);
  // An unbound socket reports no path; there is no file to remove then.
  size_t n = len > offsetof(sockaddr_un, sun_path)
                 ? strnlen(addr.sun_path, len - offsetof(sockaddr_un, sun_path))
                 : 0;
  if (n > 0) unlink(std::string(addr.sun_path, n).c_str());
  return 0;
}

int IPCListener::CloseSocket(int s) {
  if (s == -1) return -1;
  shutdown(s, SHUT_RDWR);
  ::close(s);
  return 0;
}

int IPCListener::OpenSocket(int port) {
  int s = socket(AF_INET, SOCK_STREAM, IPPROTO_TCP);
  if (s < 0) {
    LogCallFailure("socket");
    return -1;
  }
  sockaddr_in addr = LoopbackAddress(port);
  if (bind(s, reinterpret_cast<sockaddr*>(&addr), sizeof addr) != 0) {
    LogCallFailure("bind");
    CloseSocket(s);
    return -1;
  }
  if (listen(s, 8) != 0) {
    LogCallFailure("listen");
    CloseSocket(s);
    return -1;
  }
  LOG_DEBUG("listening on port %d", port);
  return s;
}

int IPCListener::do_bind(int s, int port) {
  for (int p = port;; ++p) {
    LOG_INFO("Try to bind port: %d", p);
    if (p > 65535) {
      LOG_ERROR("Port number exceeds 65536");
      return -1;
    }
    sockaddr_in addr = LoopbackAddress(p);
    if (bind(s, reinterpret_cast<sockaddr*>(&addr), sizeof addr) == 0) {
      LOG_INFO("Bind port %d success", port);
      return p;
    }
    LogCallFailure("bind");
    LOG_INFO("Bind port %d failed, try next one", p);
  }
}

int IPCListener::prepare(const std::string& path) {
  if (fd >= 0) return -1;
  int s = OpenDomainSocket(path);
  if (s < 0) return -1;
  fd = s;
  domain_path = path;
  return 0;
}

int IPCListener::prepare(int port) {
  if (fd >= 0) {
    CloseSocket(fd);
    fd = -1;
  }
  int s = socket(AF_INET, SOCK_STREAM, IPPROTO_TCP);
  if (s < 0) {
    LogCallFailure("socket");
    return -1;
  }
  int bound = do_bind(s, port);
  if (bound < 0) {
    LOG_ERROR("find available port failed");
  } else if (listen(s, 8) != 0) {
    LogCallFailure("listen");
  } else {
    LOG_INFO("listening on port %d", bound);
    fd = s;
    return bound;
  }
  CloseSocket(s);
  return -1;
}

void IPCListener::setTimeout(timeval tv) { timeout = tv; }

int IPCListener::getFD() const { return fd; }

int IPCListener::isReady() {
  if (fd == -1 || fd >= FD_SETSIZE) return 0;
  fd_set rset;
  FD_ZERO(&rset);
  FD_SET(fd, &rset);
  timeval tv = timeout;
  int n = select(fd + 1, &rset, nullptr, nullptr, &tv);
  return n > 0 && FD_ISSET(fd, &rset) ? 1 : 0;
}

int IPCListener::accept() {
  if (fd == -1) return -1;
  return ::accept(fd, nullptr, nullptr);
}

int IPCListener::close() {
  if (fd == -1) return -1;
  if (domain_path.empty()) {
    CloseSocket(fd);
  } else {
    CloseDomainSocket(fd);
  }
  fd = -1;
  domain_path.clear();
  return 0;
}

// ---------------------------------------------------------------------------
// IPCSender.

IPCSender::IPCSender() : channel_(kSenderCapacity) {}

IPCSender::~IPCSender() { close(); }

int IPCSender::connect(const std::string& path) {
  if (!FitsSocketAddress(path)) {
    LOG_ERROR("socket path too long (%zu bytes): '%s'", path.size(),
              path.c_str());
    return -1;
  }
  return channel_.Open(path.c_str()) < 0 ? -1 : 0;
}

int IPCSender::connect(int port) {
  // A negative port is answered with success by the channel, which then
  // stays closed.
  if (channel_.Open("127.0.0.1", port) < 0 || channel_.IsClosed()) return -1;
  return 0;
}

int IPCSender::assign(int fd) { return channel_.Open(fd, true) < 0 ? -1 : 0; }

int IPCSender::close() { return channel_.Close(); }

int IPCSender::send(const PObject& msg) {
  PStream stream;
  return stream.Send(channel_, msg) < 0 ? -1 : 0;
}

int IPCSender::send(const PObject& msg, bool wait_reply, PObject& reply) {
  int r = send(msg);
  if (r == 0 && wait_reply) return recv(reply);
  return r;
}

int IPCSender::recv(PObject& msg) {
  PStream stream;
  return stream.Recv(channel_, msg) < 0 ? -1 : 0;
}

}  // namespace S2S
