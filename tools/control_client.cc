#include "control_client.h"

#include <errno.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include "S2S/ipc.h"
#include "service/config.h"

namespace s2s_tools {

namespace {

// Connects a Unix-domain stream socket to `path` itself rather than through
// the sender, so that the reason of a failure (errno) reaches the person.
int ConnectUnix(const std::string& path, int& err) {
  sockaddr_un addr;
  memset(&addr, 0, sizeof addr);
  if (path.empty() || path.size() >= sizeof addr.sun_path) {
    err = ENAMETOOLONG;
    return -1;
  }
  int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) {
    err = errno;
    return -1;
  }
  addr.sun_family = AF_UNIX;
  memcpy(addr.sun_path, path.data(), path.size());
  int rc;
  do {
    rc = connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr);
  } while (rc != 0 && errno == EINTR);
  if (rc != 0) {
    err = errno;
    close(fd);
    return -1;
  }
  return fd;
}

// Whether every string and key in `v` fits the wire's 16-bit length.
bool Carriable(const S2S::PObject& v) {
  if (v.isString()) return v.asString().size() <= 0xFFFF;
  for (const auto& member : v.asMap()) {
    if (member.first.size() > 0xFFFF || !Carriable(member.second)) return false;
  }
  for (const S2S::PObject& item : v.asArray()) {
    if (!Carriable(item)) return false;
  }
  return true;
}

}  // namespace

ControlClient::ControlClient(const std::string& socket_path)
    : path_(socket_path.empty() ? s2s_service::SocketPath() : socket_path) {}

ControlClient::Status ControlClient::Call(const S2S::PObject& request,
                                          S2S::PObject& reply,
                                          std::string& error) const {
  if (!Carriable(request)) {
    error = "a value of 64 KiB or more cannot go to s2sd";
    return kUnsendable;
  }
  int err = 0;
  int fd = ConnectUnix(path_, err);
  if (fd < 0) {
    error = "cannot connect to " + path_ + ": " + strerror(err);
    if (err == EACCES || err == EPERM) {
      error += " (the control socket is for root)";
      return kRefused;
    }
    if (err == ENOENT || err == ECONNREFUSED) error += " (is s2sd running?)";
    return kUnreachable;
  }
  S2S::IPCSender sender;
  if (sender.assign(fd) != 0) {
    close(fd);
    error = "cannot use the connection to " + path_;
    return kBroken;
  }
  sender.channel().SetTimeout(timeout_);
  reply = S2S::PObject();
  // A refusal may come before the request is read, and the daemon may have
  // closed by the time the request is written: the reply is read whether
  // or not the request went out whole.
  sender.send(request);
  if (sender.recv(reply) != 0) {
    error = "s2sd closed the connection without a reply";
    return kBroken;
  }
  if (!reply.isMap() || !reply["result"].isInteger() ||
      !reply["message"].isString()) {
    error = "s2sd answered with something other than a reply";
    return kBroken;
  }
  return kReplied;
}

}  // namespace s2s_tools
