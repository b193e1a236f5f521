// Channel over TLS: the operations behind the slots once a channel has been
// converted. The handle is then the SSL session, which owns its descriptor
// and (through the session) its context.
#include <errno.h>
#include <openssl/err.h>
#include <openssl/ssl.h>
#include <string.h>

#include "S2S/channel.h"
#include "S2S/channel_wait.h"
#include "S2S/result_codes.h"

#define S2S_LOG_AREA "channel"
#include "S2S/log.h"

namespace S2S {

void log_ssl() {
  unsigned long e;
  char text[256];
  while ((e = ERR_get_error()) != 0) {
    ERR_error_string_n(e, text, sizeof text);
    LOG_WARNING("ssl-errors: %s", text);
  }
}

namespace {

int SSLRead(void* h, void* buf, unsigned int len, const timeval& slice,
            int* flag) {
  return Channel::SSLReadFd(static_cast<SSL*>(h), buf, len, slice, flag);
}

int SSLWrite(void* h, const void* buf, unsigned int len, const timeval& slice,
             int* flag) {
  return Channel::SSLWriteFd(static_cast<SSL*>(h), buf, len, slice, flag);
}

int SSLFd(void* h) { return SSL_get_fd(static_cast<SSL*>(h)); }

void SSLDestroy(void* h) {
  LOG_DEBUG("destroy ssl obj %p", h);
  if (h == nullptr) return;
  SSL* ssl = static_cast<SSL*>(h);
  int fd = SSL_get_fd(ssl);
  SSL_CTX* ctx = SSL_get_SSL_CTX(ssl);
  SSL_shutdown(ssl);
  // The context was made for this session alone; the session's reference
  // keeps it alive until SSL_free, ours is dropped after.
  SSL_free(ssl);
  if (ctx != nullptr) SSL_CTX_free(ctx);
  if (fd != -1) detail::CloseSocketFd(fd);
}

int SSLIsClosed(void* h) { return h == nullptr; }

}  // namespace

namespace detail {

void InstallSSLOps(Channel::ReadOp* read_op, Channel::WriteOp* write_op,
                   Channel::FdOp* fd_of, Channel::DestroyOp* destroy_op,
                   Channel::IsClosedOp* is_closed_op) {
  *read_op = &SSLRead;
  *write_op = &SSLWrite;
  *fd_of = &SSLFd;
  *destroy_op = &SSLDestroy;
  *is_closed_op = &SSLIsClosed;
}

}  // namespace detail

int Channel::SSLReadFd(SSL* ssl, void* buf, unsigned int len,
                       const timeval& slice, int* flag) {
  if (len == 0) {
    LOG_WARNING("ReadFd: request 0");
    return kInvalidArgument;
  }
  int fd = SSL_get_fd(ssl);
  if (SSL_pending(ssl) > 0) {
    int n = SSL_read(ssl, buf, static_cast<int>(len));
    if (n <= 0) {
      LOG_WARNING("Diagnose: SSL_read failed");
      log_ssl();
      return kIOError;
    }
    return n;
  }
  int ready = detail::WaitReady(fd, detail::kWaitRead | detail::kWaitExcept,
                                slice, flag);
  if (ready < 0) return ready;
  if (ready & detail::kWaitExcept) {
    LOG_WARNING("ReadFd: exception set");
    return kIOError;
  }
  if (!(ready & detail::kWaitRead)) {
    LOG_WARNING("ReadFd: select but fd [%d] not ready", fd);
    return kSystemError;
  }
  int n = SSL_read(ssl, buf, static_cast<int>(len));
  if (n > 0) {
    LOG_DEBUG("ReadFd: read %d bytes", n);
    return n;
  }
  int err = SSL_get_error(ssl, n);
  if (err == SSL_ERROR_WANT_READ || err == SSL_ERROR_WANT_WRITE) {
    LOG_DEBUG("SSL want read");
    return kConnectionTimeout;
  }
  log_ssl();
  return kIOError;
}

int Channel::SSLWriteFd(SSL* ssl, const void* buf, unsigned int len,
                        const timeval& slice, int* flag) {
  int fd = SSL_get_fd(ssl);
  int ready = detail::WaitReady(fd, detail::kWaitWrite | detail::kWaitExcept,
                                slice, flag);
  if (ready < 0) return ready;
  if (ready & detail::kWaitExcept) {
    LOG_WARNING("WriteFd: exception set");
    return kIOError;
  }
  if (!(ready & detail::kWaitWrite)) {
    LOG_WARNING("WriteFd: select but fd [%d] not ready", fd);
    return kSystemError;
  }
  int n = SSL_write(ssl, buf, static_cast<int>(len));
  if (n > 0) {
    LOG_DEBUG("WriteFd: write %d bytes", n);
    return n;
  }
  int e = errno;
  int err = SSL_get_error(ssl, n);
  if (err == SSL_ERROR_WANT_READ || err == SSL_ERROR_WANT_WRITE) {
    LOG_DEBUG("SSL want write");
    return kConnectionTimeout;
  }
  if (err == SSL_ERROR_SYSCALL) {
    LOG_WARNING("syscall error: n = %d, ssl_ret = %d, errno = %d, err = %s", n,
                err, e, strerror(e));
    return kSystemError;
  }
  LOG_WARNING("misc error: n = %d, ssl_ret = %d, errno = %d", n, err, e);
  log_ssl();
  return kIOError;
}

int Channel::ConvertToSSLChannel(bool /*server*/) {
  LOG_WARNING("Open: init ssl failed");
  return kIOError;
}

}  // namespace S2S
