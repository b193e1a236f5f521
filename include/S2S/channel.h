// Channel: a buffered, time-limited, cancellable byte-stream endpoint.
//
// A Channel owns one connected stream socket (TCP over IPv4 or a Unix-domain
// stream socket) and one ring buffer of `capacity` bytes in each direction.
// Waits for readiness use select() in 1-second slices; a whole operation gives
// up after `timeout` seconds without progress (0: never). A caller-owned cancel
// flag, when nonzero, stops every wait loop within one slice. Integers travel
// most significant byte first. The socket-level operations sit behind five
// slots that SwitchChannelOp() exchanges, so the same object can carry TLS
// (ConvertToSSLChannel) without its users noticing.
//
// Every operation returns a result code (S2S/result_codes.h): 0 on success, a
// negative code on failure. A failure leaves the socket open; the owner decides
// whether to Close(). Both rings are allocated once by the constructor; reads
// and writes never allocate.
//
// Thread-safety: none. One thread uses a Channel at a time; another thread may
// only stop a blocked operation by setting the caller's flag.
#ifndef S2S_CHANNEL_H_
#define S2S_CHANNEL_H_

#include <stdint.h>
#include <sys/time.h>

#include <string>

#include "S2S/export.h"

typedef struct ssl_st SSL;
typedef struct ssl_ctx_st SSL_CTX;

namespace S2S {

class S2S_EXPORT Channel {
 public:
  // Slot signatures; `handle` is the connection (see the data members).
  typedef int (*ReadOp)(void* handle, void* buf, unsigned int len,
                        const timeval& slice, int* flag);
  typedef int (*WriteOp)(void* handle, const void* buf, unsigned int len,
                         const timeval& slice, int* flag);
  typedef int (*FdOp)(void* handle);
  typedef void (*DestroyOp)(void* handle);
  typedef int (*IsClosedOp)(void* handle);

  // Allocates both rings of `capacity` bytes; closed, plain, timeout 60 s,
  // no flag, untrusted peers allowed.
  explicit Channel(unsigned int capacity);
  Channel(const Channel&) = delete;
  Channel& operator=(const Channel&) = delete;
  // Close(), then frees the rings.
  virtual ~Channel();

  // Unix-domain client at `path` (at most 107 bytes are used). 0; -3 when no
  // socket or non-blocking mode; -2 when the connect fails.
  virtual int Open(const char* path);
  // Adopts a connected descriptor; with `setopts`, linger 1 s and non-blocking
  // mode are set on it. 0; -4 when already open or fd is -1; -3 when an
  // option cannot be set.
  virtual int Open(int fd, bool setopts);
  // TCP client to a dotted-quad `ip`. A null ip or a negative port returns 0
  // and leaves the channel closed (callers test IsClosed()). 0; -2 when no
  // socket or the connect fails or times out; -3 when an option fails.
  virtual int Open(const char* ip, int port);
  // Flushes what is buffered (a failure is logged, not returned), tears the
  // connection down and returns to plain operations. Always 0; harmless on a
  // closed channel.
  virtual int Close();
  virtual int SetTimeout(unsigned int seconds);
  // The channel only reads through `flag`; it must outlive every operation.
  virtual int SetFlag(int* flag);
  // Turns an open plain channel into TLS in place, as server end (presents
  // GetCertPath() and GetKeyPath()) or client end. A client that does not
  // allow untrusted peers checks the chain against GetCAPath() and, when a
  // host name is set, the name (SetSSLHostname). 0; -2 when the channel is
  // closed, on set-up failure and when the handshake fails or outlasts the
  // time-out; -24 when verification fails. A failure leaves the channel open
  // and plain. 0 without change when already TLS. Close() returns to plain.
  //
  // The handshake uses the library's general-purpose method; with OpenSSL 3
  // at its default security level that allows TLS 1.2 and TLS 1.3 only
  // (older versions need security level 0 on both ends).
  virtual int ConvertToSSLChannel(bool server);

  // Integer reads fill the output only on success.
  virtual int ReadByte(unsigned char* v);
  virtual int ReadInt16(unsigned short* v);
  virtual int ReadInt32(unsigned int* v);
  virtual int ReadInt64(unsigned long long* v);
  virtual int WriteByte(unsigned char v);
  virtual int WriteInt16(unsigned short v);
  virtual int WriteInt32(unsigned int v);
  virtual int WriteInt64(unsigned long long v);

  // Reads exactly `len` bytes. 0; -2 when closed or the peer fails; -9 after
  // the time-out; -1 when the flag is set.
  virtual int Read(char* buf, unsigned int len);
  // As above; `got` says how many bytes reached `buf`, also on failure.
  virtual int Read(char* buf, unsigned int len, unsigned int& got);
  // Buffers `len` bytes, flushing only what is needed to make room. 0; -2
  // when closed; -4 when len exceeds the capacity (split larger payloads);
  // a FlushWrite failure.
  virtual int Write(const char* buf, unsigned int len);
  // Drop buffered bytes without sending them. Always 0.
  virtual int ClearRead();
  virtual int ClearWrite();
  // Sends at least `want` buffered bytes (0: everything). 0; -9, -1, -2, -3.
  virtual int FlushWrite(int want);
  // Peer address of a TCP channel. `port` is the 16-bit value exactly as the
  // socket address stores it (network byte order). 0 (closed: "" and 0); -3
  // when getpeername fails; -1 when the address cannot be printed.
  virtual int GetPeerInfo(std::string& ip, int& port) const;
  virtual bool IsClosed() const;
  // Reads at least `want` new bytes into the read ring. 0 or a failure code.
  virtual int ReadMore(int want);

  // Unconditional byte swaps (not host-to-network conversions).
  virtual unsigned long long Convert(unsigned long long v);
  virtual unsigned int Convert(unsigned int v);
  virtual unsigned short Convert(unsigned short v);

  // socket(AF_INET, SOCK_STREAM): the descriptor or -1.
  virtual int CreateSock();
  // 0, or -1 with a warning.
  virtual int SetLinger(int fd, int seconds);
  virtual int SetNonBlock(int fd);
  // Non-blocking connect to ip:port bounded by the channel's time-out. 0;
  // -4 bad arguments; -3 connect/select failure; -2 socket exception; -9
  // timed out; -1 flag set.
  virtual int ConnectWithTimeout(int fd, const char* ip, int port);
  // Mode 1 installs the plain socket operations, any other value the TLS
  // ones. Changes neither the handle nor the TLS state.
  virtual int SwitchChannelOp(int mode);

  // Socket-level operations behind the slots: bytes moved, or -4 (zero
  // length read), -9 (one slice passed), -1 (flag), -2 (socket failure or
  // peer closed), -3 (select failure).
  static int ReadFd(int* fd, void* buf, unsigned int len, const timeval& slice,
                    int* flag);
  static int WriteFd(int* fd, const void* buf, unsigned int len,
                     const timeval& slice, int* flag);
  static int SSLReadFd(SSL* ssl, void* buf, unsigned int len,
                       const timeval& slice, int* flag);
  static int SSLWriteFd(SSL* ssl, const void* buf, unsigned int len,
                        const timeval& slice, int* flag);

  unsigned int GetCapacity() const { return capacity; }
  unsigned int GetTimeout() const { return timeout; }
  bool IsSSL() const { return is_ssl; }

  // TLS settings (channel_ssl.cc). They survive Close(). A client end that
  // allows untrusted peers (the default) accepts any server certificate and
  // loads no CA file. An empty host name (the default) skips the name check.
  void SetAllowUntrust(bool allow) { allow_untrust = allow; }
  bool IsAllowingUntrust() const { return allow_untrust; }
  // A name matches the certificate's subject common name or any DNS entry of
  // its alternative names, ignoring case; "*.example.test" stands for one
  // leading label ("a.example.test", not "a.b.example.test").
  void SetSSLHostname(const std::string& name) { ssl_hostname = name; }

  // Process-wide file locations: the server end's certificate chain and PEM
  // private key, and the CA file a client end verifies against. Set them
  // before the first conversion; they are not guarded.
  static const std::string& GetCertPath();
  static void SetCERTPath(std::string path);
  static const std::string& GetKeyPath();
  static void SetPriKeyPath(std::string path);
  static const std::string& GetCAPath();
  static void SetVerifyCAPath(const std::string& path);

  // The steps of a conversion. InitSSL makes a context and a session for
  // one end (0, or -1 with both freed); DeinitSSL frees what is there and
  // nulls the pointers, sending close_notify first when `shutdown`;
  // SSLHandshake drives the handshake on the session's descriptor, one
  // `slice` at a time, until done (0), failed (-2, -3) or `timeout` seconds
  // pass without progress (-9; 0 waits for ever). The cancel flag is not
  // watched during a handshake. The Install functions load the files above
  // into a context: 0, or -1 with the OpenSSL errors logged.
  static int InitSSL(SSL*& ssl, SSL_CTX*& ctx, bool server, bool allowUntrust);
  static int DeinitSSL(SSL*& ssl, SSL_CTX*& ctx, bool shutdown);
  static int SSLHandshake(SSL* ssl, timeval slice, unsigned int timeout,
                          int* flag);
  static int InstallCERT(SSL_CTX* ctx);
  static int InstallPriKey(SSL_CTX* ctx);
  static int InstallVerifyCA(SSL_CTX* ctx);

 private:
  // The general paths of Read and Write: ring runs that wrap, reads that
  // need the socket, writes that need room or are refused.
  int ReadWrapped(char* buf, unsigned int len, unsigned int& got);
  int WriteWrapped(const char* buf, unsigned int len);

  void* handle;  // int* socket for a plain channel, SSL* for TLS, or null
  ReadOp read_op;
  WriteOp write_op;
  FdOp fd_of;
  DestroyOp destroy_op;
  IsClosedOp is_closed_op;
  char* w_buf;
  uint32_t w_head;
  uint32_t w_size;
  char* r_buf;
  uint32_t r_head;
  uint32_t r_size;
  uint32_t capacity;
  timeval select_slice;
  uint32_t timeout;
  int* flag;
  bool is_ssl;
  bool allow_untrust;
  std::string ssl_hostname;
};

// Drains this thread's OpenSSL error queue into the log, one WARNING line
// "ssl-errors: ..." per entry.
S2S_EXPORT void log_ssl();

}  // namespace S2S

#endif  // S2S_CHANNEL_H_
