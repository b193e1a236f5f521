// Local IPC: PObject messages between processes of one machine, over a
// Unix-domain stream socket or TCP on 127.0.0.1.
//
// IPCListener is the server end: it owns one listening socket (and, for the
// domain form, the socket file, which close() removes). IPCSender is a
// connection end: it owns one Channel and sends or receives one whole
// PStream message per call. A descriptor from IPCListener::accept() belongs
// to the caller until it is handed to an IPCSender with assign().
//
// Results are 0 (or a descriptor or port) on success and -1 on failure; the
// reason is in the log.
//
// Thread-safety: none. A listener is used by one thread; a sender by one
// thread at a time.
#ifndef S2S_IPC_H_
#define S2S_IPC_H_

#include <sys/time.h>

#include <string>

#include "S2S/channel.h"
#include "S2S/export.h"
#include "S2S/pobject.h"

namespace S2S {

class S2S_EXPORT IPCListener {
 public:
  IPCListener();
  ~IPCListener();
  IPCListener(const IPCListener&) = delete;
  IPCListener& operator=(const IPCListener&) = delete;

  // Listens on a Unix-domain socket at `path`, replacing a leftover socket
  // file. 0; -1 when already prepared, the path is empty or too long for a
  // socket address, or a socket call fails.
  int prepare(const std::string& path);
  // Listens on 127.0.0.1 at the first free port from `port` up. The bound
  // port, or -1. A prepared listener is closed and prepared again.
  int prepare(int port);
  // How long isReady() waits (default 3 s).
  void setTimeout(timeval tv);
  int getFD() const;
  // 1 when a client waits to be accepted, 0 after the time-out or on error.
  int isReady();
  // The connected descriptor (owned by the caller), or -1.
  int accept();
  // Closes the listener (removing the domain socket file). 0; -1 when there
  // was nothing to close.
  int close();

  // Socket helpers that use no listener state. Each returns a descriptor or
  // 0 on success, -1 on failure.
  static int OpenDomainSocket(const std::string& path);
  static int CloseDomainSocket(int fd);
  static int OpenSocket(int port);
  static int CloseSocket(int fd);
  // Binds `fd` to 127.0.0.1 at the first free port from `port`; the port,
  // or -1 when none up to 65535 is free.
  static int do_bind(int fd, int port);

 private:
  timeval timeout;
  int fd;
  std::string domain_path;
};

class S2S_EXPORT IPCSender {
 public:
  IPCSender();
  virtual ~IPCSender();
  IPCSender(const IPCSender&) = delete;
  IPCSender& operator=(const IPCSender&) = delete;

  // Sends `msg`; then, when `wait_reply`, receives the answer into `reply`.
  // 0 or -1.
  virtual int send(const PObject& msg, bool wait_reply, PObject& reply);
  virtual int send(const PObject& msg);
  // Receives one message into `msg` (merging into a map it holds). 0 or -1;
  // after -1 the connection is unusable: close() it.
  virtual int recv(PObject& msg);

  // Connects to a Unix-domain socket; a path too long for a socket address
  // is refused. 0 or -1.
  int connect(const std::string& path);
  // Connects to 127.0.0.1:port. 0 or -1.
  int connect(int port);
  // Adopts a connected descriptor (linger and non-blocking mode set). On
  // success the sender owns it. 0 or -1.
  int assign(int fd);
  int close();

  // The underlying channel, for time-out and cancel-flag settings.
  Channel& channel() { return channel_; }

 private:
  Channel channel_;
};

}  // namespace S2S

#endif  // S2S_IPC_H_
