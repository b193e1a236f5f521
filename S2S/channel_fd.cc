// Socket-level half of Channel: the readiness wait, the plain read and write
// operations behind the slots, and the socket options.
#include <errno.h>
#include <fcntl.h>
#include <string.h>
#include <sys/select.h>
#include <sys/socket.h>
#include <unistd.h>

#include "S2S/channel.h"
#include "S2S/channel_wait.h"
#include "S2S/result_codes.h"

#define S2S_LOG_AREA "channel"
#include "S2S/log.h"

namespace S2S {
namespace detail {

int WaitReady(int fd, int sets, const timeval& slice, int* flag) {
  // select() cannot watch a descriptor past FD_SETSIZE; refusing it here is
  // what keeps FD_SET from writing beyond the set.
  if (fd < 0 || fd >= FD_SETSIZE) {
    LOG_WARNING("select: %s (%d)", strerror(EBADF), EBADF);
    return kSystemError;
  }
  while (flag == nullptr || *flag == 0) {
    timeval tv = slice;
    fd_set rset, wset, eset;
    FD_ZERO(&rset);
    FD_ZERO(&wset);
    FD_ZERO(&eset);
    if (sets & kWaitRead) FD_SET(fd, &rset);
    if (sets & kWaitWrite) FD_SET(fd, &wset);
    if (sets & kWaitExcept) FD_SET(fd, &eset);
    int n = select(fd + 1, (sets & kWaitRead) ? &rset : nullptr,
                   (sets & kWaitWrite) ? &wset : nullptr,
                   (sets & kWaitExcept) ? &eset : nullptr, &tv);
    if (n > 0) {
      int ready = 0;
      if ((sets & kWaitRead) && FD_ISSET(fd, &rset)) ready |= kWaitRead;
      if ((sets & kWaitWrite) && FD_ISSET(fd, &wset)) ready |= kWaitWrite;
      if ((sets & kWaitExcept) && FD_ISSET(fd, &eset)) ready |= kWaitExcept;
      return ready;
    }
    if (n == 0) {
      LOG_DEBUG("select: timeout");
      return kConnectionTimeout;
    }
    if (errno == EINTR) continue;
    int e = errno;
    LOG_WARNING("select: %s (%d)", strerror(e), e);
    return kSystemError;
  }
  return kInterrupted;
}

void CloseSocketFd(int fd) {
  if (shutdown(fd, SHUT_RDWR) != 0) {
    LOG_DEBUG("Channel: shutdown: %s", strerror(errno));
  }
  close(fd);
  LOG_DEBUG("Channel: socket %d closed", fd);
}

}  // namespace detail

using detail::kWaitExcept;
using detail::kWaitRead;
using detail::kWaitWrite;

int Channel::ReadFd(int* fd, void* buf, unsigned int len, const timeval& slice,
                    int* flag) {
  if (len == 0) {
    LOG_WARNING("ReadFd: request 0");
    return kInvalidArgument;
  }
  int ready = detail::WaitReady(*fd, kWaitRead | kWaitExcept, slice, flag);
  if (ready < 0) return ready;
  if (ready & kWaitExcept) {
    LOG_WARNING("ReadFd: exception set");
    return kIOError;
  }
  if (!(ready & kWaitRead)) {
    LOG_WARNING("ReadFd: select but fd [%d] not ready", *fd);
    return kSystemError;
  }
  ssize_t n = recv(*fd, buf, len, 0);
  if (n < 0) {
    LOG_WARNING("read: %s", strerror(errno));
    return kIOError;
  }
  if (n == 0) {
    LOG_WARNING("read: %s", strerror(errno));
    LOG_WARNING(
        "Diagnose: select says the socket is readable but actually we can't "
        "read ... connection closed?");
    return kIOError;
  }
  LOG_DEBUG("ReadFd: read %d bytes", static_cast<int>(n));
  return static_cast<int>(n);
}

int Channel::WriteFd(int* fd, const void* buf, unsigned int len,
                     const timeval& slice, int* flag) {
  int ready = detail::WaitReady(*fd, kWaitWrite | kWaitExcept, slice, flag);
  if (ready < 0) return ready;
  if (ready & kWaitExcept) {
    LOG_WARNING("WriteFd: exception occurs");
    return kIOError;
  }
  if (!(ready & kWaitWrite)) {
    LOG_WARNING("WriteFd: select but fd [%d] not ready", *fd);
    return kSystemError;
  }
  // MSG_NOSIGNAL: a peer that went away is a -2, not a SIGPIPE for the host.
  ssize_t n = send(*fd, buf, len, MSG_NOSIGNAL);
  if (n < 0) {
    LOG_WARNING("write: %s", strerror(errno));
    return kIOError;
  }
  if (n == 0) {
    LOG_WARNING("write: %s", strerror(errno));
    LOG_WARNING(
        "Diagnose: select says the socket is writeable but actually we can't "
        "write ... connection closed?");
    return kIOError;
  }
  LOG_DEBUG("WriteFd: write %d bytes", static_cast<int>(n));
  return static_cast<int>(n);
}

int Channel::CreateSock() { return socket(AF_INET, SOCK_STREAM, 0); }

int Channel::SetLinger(int fd, int seconds) {
  linger l;
  l.l_onoff = 1;
  l.l_linger = seconds;
  if (setsockopt(fd, SOL_SOCKET, SO_LINGER, &l, sizeof l) != 0) {
    LOG_WARNING("setsockopt: %s", strerror(errno));
    return -1;
  }
  return 0;
}

int Channel::SetNonBlock(int fd) {
  if (fd == -1) return -1;
  int flags = fcntl(fd, F_GETFL);
  if (flags < 0) {
    LOG_WARNING("fcntl: %s", strerror(errno));
    return -1;
  }
  if (!(flags & O_NONBLOCK) && fcntl(fd, F_SETFL, flags | O_NONBLOCK) < 0) {
    LOG_WARNING("fcntl: %s", strerror(errno));
    return -1;
  }
  return 0;
}

unsigned long long Channel::Convert(unsigned long long v) {
  return __builtin_bswap64(v);
}

unsigned int Channel::Convert(unsigned int v) { return __builtin_bswap32(v); }

unsigned short Channel::Convert(unsigned short v) {
  return __builtin_bswap16(v);
}

}  // namespace S2S
