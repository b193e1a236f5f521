// Channel over TLS: converting an open channel in place, and the operations
// behind the slots once it is converted. The handle is then the SSL session,
// which owns its descriptor and (through the session) its context.
#include <errno.h>
#include <openssl/err.h>
#include <openssl/ssl.h>
#include <openssl/x509v3.h>
#include <stdint.h>
#include <string.h>
#include <sys/socket.h>

#include <string>

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

// The session's transport: a socket BIO of our own, because OpenSSL's sends
// with write(), which raises SIGPIPE once the peer is gone. This one sends
// with MSG_NOSIGNAL, as the plain channel does, so a vanished peer is a
// result code and not the death of the host. The descriptor is not owned.
int NoSignalWrite(BIO* b, const char* buf, int len) {
  int fd = static_cast<int>(reinterpret_cast<intptr_t>(BIO_get_data(b)));
  ssize_t n = send(fd, buf, static_cast<size_t>(len), MSG_NOSIGNAL);
  BIO_clear_retry_flags(b);
  if (n < 0 && BIO_sock_should_retry(-1)) BIO_set_retry_write(b);
  return static_cast<int>(n);
}

int NoSignalRead(BIO* b, char* buf, int len) {
  int fd = static_cast<int>(reinterpret_cast<intptr_t>(BIO_get_data(b)));
  ssize_t n = recv(fd, buf, static_cast<size_t>(len), 0);
  BIO_clear_retry_flags(b);
  if (n < 0 && BIO_sock_should_retry(-1)) BIO_set_retry_read(b);
  if (n == 0) BIO_set_flags(b, BIO_FLAGS_IN_EOF);
  return static_cast<int>(n);
}

long NoSignalCtrl(BIO* b, int cmd, long /*num*/, void* ptr) {
  switch (cmd) {
    case BIO_C_SET_FD:
      BIO_set_data(b, reinterpret_cast<void*>(
                          static_cast<intptr_t>(*static_cast<int*>(ptr))));
      BIO_set_init(b, 1);
      return 1;
    case BIO_C_GET_FD: {
      if (!BIO_get_init(b)) return -1;
      int fd = static_cast<int>(reinterpret_cast<intptr_t>(BIO_get_data(b)));
      if (ptr != nullptr) *static_cast<int*>(ptr) = fd;
      return fd;
    }
    case BIO_CTRL_EOF:
      return BIO_test_flags(b, BIO_FLAGS_IN_EOF) != 0;
    case BIO_CTRL_FLUSH:
      return 1;
    default:
      return 0;
  }
}

const BIO_METHOD* NoSignalSocket() {
  static const BIO_METHOD* method = [] {
    // A descriptor type, so that SSL_get_fd finds the socket.
    BIO_METHOD* m = BIO_meth_new(
        BIO_get_new_index() | BIO_TYPE_SOURCE_SINK | BIO_TYPE_DESCRIPTOR,
        "s2s socket");
    if (m != nullptr) {
      BIO_meth_set_write(m, NoSignalWrite);
      BIO_meth_set_read(m, NoSignalRead);
      BIO_meth_set_ctrl(m, NoSignalCtrl);
    }
    return m;
  }();
  return method;
}

// SSL_set_fd with the socket BIO above: 1 on success.
int SetSessionFd(SSL* ssl, int fd) {
  const BIO_METHOD* method = NoSignalSocket();
  BIO* bio = method == nullptr ? nullptr : BIO_new(method);
  if (bio == nullptr) return 0;
  BIO_set_fd(bio, fd, BIO_NOCLOSE);
  SSL_set_bio(ssl, bio, bio);
  return 1;
}

// Sends close_notify where possible. What a shutdown leaves in the error
// queue (a peer already gone, a handshake never finished) is of no interest
// to anyone once the session is being thrown away.
void ShutdownSession(SSL* ssl) {
  SSL_shutdown(ssl);
  ERR_clear_error();
}

std::string& CertPath() {
  static std::string path("/tmp/.cloud_certs");
  return path;
}

std::string& KeyPath() {
  static std::string path("/tmp/.cloud_server.key");
  return path;
}

std::string& CAPath() {
  static std::string path("/certs.pem");
  return path;
}

bool EqualNoCase(const char* a, size_t alen, const char* b, size_t blen) {
  if (alen != blen) return false;
  for (size_t i = 0; i < alen; ++i) {
    unsigned char x = static_cast<unsigned char>(a[i]);
    unsigned char y = static_cast<unsigned char>(b[i]);
    if (x >= 'A' && x <= 'Z') x = static_cast<unsigned char>(x - 'A' + 'a');
    if (y >= 'A' && y <= 'Z') y = static_cast<unsigned char>(y - 'A' + 'a');
    if (x != y) return false;
  }
  return true;
}

// A certificate name against the host name. "*.rest" stands for exactly one
// leading label: it matches "a.rest", never "a.b.rest" nor "rest". A name
// with an embedded zero byte is forged and matches nothing.
bool NameMatches(const char* cert, size_t len, const std::string& host) {
  if (memchr(cert, '\0', len) != nullptr) return false;
  if (len >= 2 && cert[0] == '*' && cert[1] == '.') {
    size_t dot = host.find('.');
    if (dot == std::string::npos) return false;
    return EqualNoCase(cert + 2, len - 2, host.data() + dot + 1,
                       host.size() - dot - 1);
  }
  return EqualNoCase(cert, len, host.data(), host.size());
}

bool CommonNameMatches(X509* cert, const std::string& host) {
  X509_NAME* subject = X509_get_subject_name(cert);
  int at = X509_NAME_get_index_by_NID(subject, NID_commonName, -1);
  if (at < 0) return false;
  ASN1_STRING* data =
      X509_NAME_ENTRY_get_data(X509_NAME_get_entry(subject, at));
  unsigned char* utf8 = nullptr;
  int len = ASN1_STRING_to_UTF8(&utf8, data);
  if (len < 0) return false;
  bool ok = NameMatches(reinterpret_cast<const char*>(utf8),
                        static_cast<size_t>(len), host);
  OPENSSL_free(utf8);
  return ok;
}

bool AltNameMatches(X509* cert, const std::string& host) {
  GENERAL_NAMES* names = static_cast<GENERAL_NAMES*>(
      X509_get_ext_d2i(cert, NID_subject_alt_name, nullptr, nullptr));
  if (names == nullptr) return false;
  bool ok = false;
  for (int i = 0; i < sk_GENERAL_NAME_num(names); ++i) {
    const GENERAL_NAME* name = sk_GENERAL_NAME_value(names, i);
    if (name->type != GEN_DNS) continue;
    const ASN1_IA5STRING* dns = name->d.dNSName;
    if (NameMatches(reinterpret_cast<const char*>(ASN1_STRING_get0_data(dns)),
                    static_cast<size_t>(ASN1_STRING_length(dns)), host)) {
      ok = true;
    }
  }
  GENERAL_NAMES_free(names);
  return ok;
}

// The chain verdict of the handshake, then the name: the subject's common
// name, else any DNS entry of the alternative names.
bool PeerVerified(SSL* ssl, const std::string& host) {
  long verdict = SSL_get_verify_result(ssl);
  if (verdict != X509_V_OK) {
    LOG_DEBUG("ConvertToSSLChannel: %s",
              X509_verify_cert_error_string(verdict));
    return false;
  }
  if (host.empty()) return true;
  X509* cert = SSL_get1_peer_certificate(ssl);
  if (cert == nullptr) return false;
  bool ok = CommonNameMatches(cert, host) || AltNameMatches(cert, host);
  X509_free(cert);
  if (!ok) LOG_DEBUG("ConvertToSSLChannel: no name matches %s", host.c_str());
  return ok;
}

// The context's list of suites for TLS 1.2 and below, in order, as a
// cipher string.
std::string PreTLS13Ciphers(SSL_CTX* ctx) {
  std::string names;
  STACK_OF(SSL_CIPHER)* list = SSL_CTX_get_ciphers(ctx);
  for (int i = 0; i < sk_SSL_CIPHER_num(list); ++i) {
    const SSL_CIPHER* c = sk_SSL_CIPHER_value(list, i);
    if (strcmp(SSL_CIPHER_get_version(c), "TLSv1.3") == 0) continue;
    if (!names.empty()) names += ':';
    names += SSL_CIPHER_get_name(c);
  }
  return names;
}

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
  ShutdownSession(ssl);
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

const std::string& Channel::GetCertPath() { return CertPath(); }
void Channel::SetCERTPath(std::string path) { CertPath() = std::move(path); }
const std::string& Channel::GetKeyPath() { return KeyPath(); }
void Channel::SetPriKeyPath(std::string path) { KeyPath() = std::move(path); }
const std::string& Channel::GetCAPath() { return CAPath(); }
void Channel::SetVerifyCAPath(const std::string& path) { CAPath() = path; }

int Channel::InstallCERT(SSL_CTX* ctx) {
  LOG_DEBUG("cert path = %s", GetCertPath().c_str());
  if (SSL_CTX_use_certificate_chain_file(ctx, GetCertPath().c_str()) != 1) {
    LOG_WARNING("Install certificate failed");
    log_ssl();
    return -1;
  }
  return 0;
}

int Channel::InstallPriKey(SSL_CTX* ctx) {
  if (SSL_CTX_use_PrivateKey_file(ctx, GetKeyPath().c_str(),
                                  SSL_FILETYPE_PEM) != 1) {
    LOG_WARNING("Install private key failed");
    log_ssl();
    return -1;
  }
  return 0;
}

int Channel::InstallVerifyCA(SSL_CTX* ctx) {
  if (SSL_CTX_load_verify_locations(ctx, GetCAPath().c_str(), nullptr) != 1) {
    LOG_WARNING("SSL_CTX_load_verify_locations(%s) failed",
                GetCAPath().c_str());
    log_ssl();
    return -1;
  }
  return 0;
}

int Channel::InitSSL(SSL*& ssl, SSL_CTX*& ctx, bool server, bool allowUntrust) {
  ssl = nullptr;
  ctx = SSL_CTX_new(server ? SSLv23_server_method() : SSLv23_client_method());
  if (ctx == nullptr) {
    LOG_WARNING("m_ssl_ctx created failed");
    log_ssl();
    DeinitSSL(ssl, ctx, false);
    return -1;
  }
  if (server) {
    if (InstallCERT(ctx) != 0) {
      LOG_WARNING("Open: init ssl certificate failed");
      DeinitSSL(ssl, ctx, false);
      return -1;
    }
    if (InstallPriKey(ctx) != 0) {
      LOG_WARNING("Open: init ssl private key failed");
      DeinitSSL(ssl, ctx, false);
      return -1;
    }
  } else {
    // The transport asks for this one suite first; a library that no longer
    // offers it negotiates from its own default list instead. A failed
    // SSL_CTX_set_cipher_list does not leave the list as it was (it keeps
    // only the TLS 1.3 suites), so the default is put back by name.
    std::string defaults = PreTLS13Ciphers(ctx);
    if (SSL_CTX_set_cipher_list(ctx, "RC4-MD5") != 1) {
      LOG_WARNING("can't set cipher suit to SSL3_TXT_RSA_RC4_128_MD5");
      log_ssl();
      if (!defaults.empty() &&
          SSL_CTX_set_cipher_list(ctx, defaults.c_str()) != 1) {
        log_ssl();
      }
    }
  }
  // Partial writes let FlushWrite see every record that leaves, so its
  // time-out restarts on progress as it does on a plain socket; the ring may
  // hand a retried write from a new position after ClearWrite.
  SSL_CTX_set_mode(
      ctx, SSL_MODE_ENABLE_PARTIAL_WRITE | SSL_MODE_ACCEPT_MOVING_WRITE_BUFFER);
  ssl = SSL_new(ctx);
  if (ssl == nullptr) {
    LOG_WARNING("m_ssl created failed");
    log_ssl();
    DeinitSSL(ssl, ctx, false);
    return -1;
  }
  if (server) {
    SSL_set_accept_state(ssl);
    return 0;
  }
  if (!allowUntrust && InstallVerifyCA(ctx) != 0) {
    LOG_WARNING("InitSSL(): set Verify store fail");
    DeinitSSL(ssl, ctx, false);
    return -1;
  }
  // The handshake never fails on the peer's certificate; the verdict is
  // examined once it is done (ConvertToSSLChannel).
  SSL_set_verify(ssl, SSL_VERIFY_NONE, nullptr);
  SSL_set_connect_state(ssl);
  return 0;
}

int Channel::DeinitSSL(SSL*& ssl, SSL_CTX*& ctx, bool shutdown) {
  if (ssl != nullptr) {
    if (shutdown) {
      ShutdownSession(ssl);
    } else {
      SSL_set_quiet_shutdown(ssl, 1);
    }
    SSL_free(ssl);
    ssl = nullptr;
  }
  if (ctx != nullptr) {
    SSL_CTX_free(ctx);
    ctx = nullptr;
  }
  return 0;
}

int Channel::SSLHandshake(SSL* ssl, timeval slice, unsigned int timeout,
                          int* /*flag*/) {
  // Seconds waited since the peer last moved the handshake on.
  unsigned int waited = 0;
  // SSL_get_error reads the error queue: it must hold only this call's.
  ERR_clear_error();
  int r = SSL_do_handshake(ssl);
  for (;;) {
    if (r == 1) return 0;
    int err = SSL_get_error(ssl, r);
    if (r == 0) {
      LOG_WARNING("SSLHandshake: SSL error code: %d", err);
      log_ssl();
      return kIOError;
    }
    if (err != SSL_ERROR_WANT_READ && err != SSL_ERROR_WANT_WRITE) {
      LOG_WARNING("SSLHandshake: SSL fatel error code: %d", err);
      log_ssl();
      return kIOError;
    }
    int awaited =
        err == SSL_ERROR_WANT_READ ? detail::kWaitRead : detail::kWaitWrite;
    // One slice at a time; the handshake is bounded by the time-out alone.
    int ready = detail::WaitReady(
        SSL_get_fd(ssl), awaited | detail::kWaitExcept, slice, nullptr);
    if (ready == kConnectionTimeout) {
      waited += static_cast<unsigned int>(slice.tv_sec);
      if (timeout != 0 && waited >= timeout) {
        LOG_WARNING(
            "SSLHandshake: timed out during connect (%d seconds), abort "
            "anyway",
            static_cast<int>(waited));
        return kConnectionTimeout;
      }
    } else if (ready < 0) {
      return ready;
    } else if (ready & detail::kWaitExcept) {
      LOG_WARNING("SSLHandshake: exception set");
      return kIOError;
    } else if (!(ready & awaited)) {
      LOG_WARNING("SSLHandshake: select returns but fd is not set");
      return kSystemError;
    } else {
      LOG_DEBUG("SSLHandshake: reset timeout");
      waited = 0;
    }
    ERR_clear_error();
    r = SSL_do_handshake(ssl);
  }
}

int Channel::SSLReadFd(SSL* ssl, void* buf, unsigned int len,
                       const timeval& slice, int* flag) {
  if (len == 0) {
    LOG_WARNING("ReadFd: request 0");
    return kInvalidArgument;
  }
  int fd = SSL_get_fd(ssl);
  // A record already decrypted is not on the socket any more: select would
  // not see it.
  if (SSL_pending(ssl) > 0) {
    ERR_clear_error();
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
  ERR_clear_error();
  int n = SSL_read(ssl, buf, static_cast<int>(len));
  if (n > 0) {
    LOG_DEBUG("ReadFd: read %d bytes", n);
    return n;
  }
  int err = SSL_get_error(ssl, n);
  if (err == SSL_ERROR_WANT_READ || err == SSL_ERROR_WANT_WRITE) {
    // Only part of a record has arrived: the caller's loop tries again.
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
  ERR_clear_error();
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
    log_ssl();
    return kSystemError;
  }
  LOG_WARNING("misc error: n = %d, ssl_ret = %d, errno = %d", n, err, e);
  log_ssl();
  return kIOError;
}

int Channel::ConvertToSSLChannel(bool server) {
  if (is_ssl) {
    LOG_WARNING(
        "ConvertToSSLChannel: Channel is SSL channel, no need to be converted");
    return 0;
  }
  SSL* ssl = nullptr;
  SSL_CTX* ctx = nullptr;
  if (InitSSL(ssl, ctx, server, IsAllowingUntrust()) != 0) {
    LOG_WARNING("Open: init ssl failed");
    return kIOError;
  }
  if (IsClosed()) {
    LOG_ERROR("invalid context");
    DeinitSSL(ssl, ctx, false);
    return kIOError;
  }
  if (SetSessionFd(ssl, fd_of(handle)) != 1) {
    LOG_WARNING("set fd failed");
    log_ssl();
    DeinitSSL(ssl, ctx, false);
    return kIOError;
  }
  // A handshake that outlasts the time-out (-9) is a failed conversion too.
  if (SSLHandshake(ssl, select_slice, timeout, flag) < 0) {
    LOG_WARNING("Open to SSL connect to server failed");
    DeinitSSL(ssl, ctx, true);
    return kIOError;
  }
  if (!allow_untrust && !PeerVerified(ssl, ssl_hostname)) {
    LOG_WARNING("ConvertToSSLChannel: Verify Fail!");
    DeinitSSL(ssl, ctx, true);
    return kSSLVerifyFail;
  }
  // The session takes the descriptor over (and closes it in SSLDestroy);
  // the plain handle only held its number. Our reference to the context
  // goes with the session.
  delete static_cast<int*>(handle);
  handle = ssl;
  SwitchChannelOp(0);
  is_ssl = true;
  return 0;
}

}  // namespace S2S
