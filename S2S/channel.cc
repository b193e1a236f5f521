// Channel: connection set-up and the two ring buffers.
#include "S2S/channel.h"

#include <arpa/inet.h>
#include <errno.h>
#include <netinet/in.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>

#include "S2S/channel_wait.h"
#include "S2S/result_codes.h"

#define S2S_LOG_AREA "channel"
#include "S2S/log.h"

namespace S2S {

namespace {

// The plain column of the operation slots: the handle is a heap int holding
// the socket descriptor.
int PlainRead(void* h, void* buf, unsigned int len, const timeval& slice,
              int* flag) {
  return Channel::ReadFd(static_cast<int*>(h), buf, len, slice, flag);
}

int PlainWrite(void* h, const void* buf, unsigned int len, const timeval& slice,
               int* flag) {
  return Channel::WriteFd(static_cast<int*>(h), buf, len, slice, flag);
}

int PlainFd(void* h) { return h == nullptr ? -1 : *static_cast<int*>(h); }

void PlainDestroy(void* h) {
  if (h == nullptr) return;
  int* fd = static_cast<int*>(h);
  if (*fd != -1) detail::CloseSocketFd(*fd);
  delete fd;
}

int PlainIsClosed(void* h) {
  return h == nullptr || *static_cast<int*>(h) == -1;
}

// Copies of the integer widths become single moves instead of calls.
inline void CopyBytes(char* dst, const char* src, uint32_t n) {
  switch (n) {
    case 0:
      return;
    case 1:
      *dst = *src;
      return;
    case 2:
      memcpy(dst, src, 2);
      return;
    case 4:
      memcpy(dst, src, 4);
      return;
    case 8:
      memcpy(dst, src, 8);
      return;
    default:
      memcpy(dst, src, n);
  }
}

}  // namespace

Channel::Channel(unsigned int capacity)
    : handle(nullptr),
      w_buf(new char[capacity]),
      w_head(0),
      w_size(0),
      r_buf(new char[capacity]),
      r_head(0),
      r_size(0),
      capacity(capacity),
      timeout(60),
      flag(nullptr),
      is_ssl(false),
      allow_untrust(true) {
  select_slice.tv_sec = 1;
  select_slice.tv_usec = 0;
  SwitchChannelOp(1);
}

Channel::~Channel() {
  Close();
  delete[] w_buf;
  delete[] r_buf;
}

int Channel::SwitchChannelOp(int mode) {
  if (mode == 1) {
    read_op = &PlainRead;
    write_op = &PlainWrite;
    fd_of = &PlainFd;
    destroy_op = &PlainDestroy;
    is_closed_op = &PlainIsClosed;
  } else {
    detail::InstallSSLOps(&read_op, &write_op, &fd_of, &destroy_op,
                          &is_closed_op);
  }
  return 0;
}

int Channel::SetTimeout(unsigned int seconds) {
  timeout = seconds;
  return 0;
}

int Channel::SetFlag(int* f) {
  flag = f;
  return 0;
}

bool Channel::IsClosed() const { return is_closed_op(handle) != 0; }

int Channel::ClearRead() {
  r_head = r_size = 0;
  return 0;
}

int Channel::ClearWrite() {
  w_head = w_size = 0;
  return 0;
}

int Channel::Open(const char* path) {
  int fd = socket(AF_UNIX, SOCK_STREAM, 0);
  if (fd < 0) {
    LOG_WARNING("Channel: Can not open socket. %s", strerror(errno));
    return kSystemError;
  }
  sockaddr_un addr;
  memset(&addr, 0, sizeof addr);
  addr.sun_family = AF_UNIX;
  strncpy(addr.sun_path, path, sizeof addr.sun_path - 1);
  if (connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) != 0) {
    LOG_WARNING("Channel: Can not connect to server at '%s'. %s", path,
                strerror(errno));
    close(fd);
    return kIOError;
  }
  if (SetNonBlock(fd) != 0) {
    close(fd);
    return kSystemError;
  }
  // Reopening without a Close would otherwise leak the old connection.
  destroy_op(handle);
  handle = new int(fd);
  ClearRead();
  ClearWrite();
  return 0;
}

int Channel::Open(int fd, bool setopts) {
  if (!IsClosed()) {
    LOG_WARNING("Open: Channel already opened [%d]", fd_of(handle));
    LOG_WARNING("Open: %s", ResultMessage(kInvalidArgument));
    return kInvalidArgument;
  }
  if (setopts) {
    if (SetLinger(fd, 1) != 0) {
      LOG_WARNING("Open: SetLinger to socket [%d] failed, %s", fd,
                  strerror(errno));
      return kSystemError;
    }
    if (SetNonBlock(fd) != 0) {
      LOG_WARNING("Open: SetNonBlock to socket [%d] failed, %s", fd,
                  strerror(errno));
      return kSystemError;
    }
  }
  if (fd == -1) return kInvalidArgument;
  destroy_op(handle);  // a handle holding -1
  handle = new int(fd);
  ClearRead();
  ClearWrite();
  LOG_DEBUG("Channel: opening socket %d", fd);
  return 0;
}

int Channel::Open(const char* ip, int port) {
  if (ip == nullptr || port < 0) return 0;
  int fd = CreateSock();
  if (fd == -1) return kIOError;
  if (SetLinger(fd, 1) != 0 || SetNonBlock(fd) != 0) {
    close(fd);
    return kSystemError;
  }
  if (ConnectWithTimeout(fd, ip, port) < 0) {
    close(fd);
    return kIOError;
  }
  ClearRead();
  ClearWrite();
  destroy_op(handle);
  handle = new int(fd);
  return 0;
}

int Channel::ConnectWithTimeout(int fd, const char* ip, int port) {
  if (fd == -1 || ip == nullptr) {
    LOG_WARNING("Invalid argumants (ip: %s, port: %d", ip ? ip : "(null)",
                port);
    return kInvalidArgument;
  }
  sockaddr_in addr;
  memset(&addr, 0, sizeof addr);
  addr.sin_family = AF_INET;
  addr.sin_addr.s_addr = inet_addr(ip);
  addr.sin_port = htons(static_cast<uint16_t>(port));
  if (connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) == 0) {
    return 0;
  }
  if (errno != EINPROGRESS) {
    int e = errno;
    LOG_WARNING("connect: %s (%d)", strerror(e), e);
    return kSystemError;
  }
  unsigned int elapsed = 0;
  for (;;) {
    int ready = detail::WaitReady(fd, detail::kWaitWrite | detail::kWaitExcept,
                                  select_slice, flag);
    if (ready == kConnectionTimeout) {
      // Counted as 3 per slice: a connect gives up after about a third of
      // the channel's time-out.
      elapsed += 3;
      if (timeout != 0 && elapsed >= timeout) {
        LOG_WARNING(
            "Channel timed out during connect (%d seconds), abort anyway",
            static_cast<int>(elapsed));
        return kConnectionTimeout;
      }
      continue;
    }
    if (ready < 0) return ready;
    if (ready & detail::kWaitExcept) {
      LOG_WARNING("connect: exception set");
      return kIOError;
    }
    if (!(ready & detail::kWaitWrite)) {
      LOG_WARNING("connect: write fd is not set");
      return kSystemError;
    }
    // Writable also means "failed"; the pending error tells which.
    int err = 0;
    socklen_t len = sizeof err;
    if (getsockopt(fd, SOL_SOCKET, SO_ERROR, &err, &len) == 0 && err != 0) {
      LOG_WARNING("connect: %s (%d)", strerror(err), err);
      return kIOError;
    }
    return 0;
  }
}

int Channel::Close() {
  if (handle != nullptr) {
    if (!IsClosed()) {
      int r = FlushWrite(0);
      if (r < 0) {
        LOG_WARNING("FlushWrite: %s", ResultMessage(r));
        ClearRead();
        ClearWrite();
      }
    }
    destroy_op(handle);
    handle = nullptr;
  }
  is_ssl = false;
  SwitchChannelOp(1);
  return 0;
}

int Channel::GetPeerInfo(std::string& ip, int& port) const {
  if (IsClosed()) {
    LOG_WARNING(
        "GetPeerInfo: Attempting to get info of an uninitialized "
        "channel");
    ip = "";
    port = 0;
    return 0;
  }
  sockaddr_in addr;
  socklen_t len = sizeof addr;
  memset(&addr, 0, sizeof addr);
  if (getpeername(fd_of(handle), reinterpret_cast<sockaddr*>(&addr), &len) !=
      0) {
    LOG_WARNING("GetPeerInfo: getpeername: %s", strerror(errno));
    return kSystemError;
  }
  char text[17];
  if (inet_ntop(AF_INET, &addr.sin_addr, text, sizeof text) == nullptr) {
    int e = errno;
    LOG_WARNING("GetPeerInfo: inet_ntop: %s (%d)", strerror(e), e);
    ip = "";
    port = 0;
    return kInterrupted;
  }
  ip = text;
  port = addr.sin_port;
  return 0;
}

// ---------------------------------------------------------------------------
// The rings.
//
// Every byte passes through a ring, even where a large read or write could
// go straight between the socket and the caller's buffer: what ClearRead
// and ClearWrite drop, what a flush sends, and what a subclass's ReadMore
// or FlushWrite sees all depend on the bytes being buffered there.

int Channel::ReadMore(int want) {
  if (want < 1) return 0;
  time_t start = time(nullptr);
  int total = 0;
  while (flag == nullptr || *flag == 0) {
    LOG_DEBUG(
        "ReadMore: want = %d, total = %d, len = %d, r_head = %d, "
        "r_size = %d",
        want, total, static_cast<int>(capacity), static_cast<int>(r_head),
        static_cast<int>(r_size));
    uint32_t end = r_head + r_size;
    char* at;
    uint32_t room;
    if (end < capacity) {
      at = r_buf + end;
      room = capacity - end;
    } else {
      at = r_buf + (end - capacity);
      room = capacity - r_size;
    }
    int n = read_op(handle, at, room, select_slice, flag);
    if (n == kConnectionTimeout) {
      if (timeout != 0 && time(nullptr) - start >= timeout) {
        LOG_DEBUG("ReadMore: Channel timeout for %u seconed", timeout);
        return kConnectionTimeout;
      }
      continue;
    }
    if (n < 0) return n;
    r_size += n;
    total += n;
    start = time(nullptr);
    if (total >= want) {
      LOG_DEBUG("ReadMore: read at least %d bytes", want);
      return 0;
    }
  }
  return kInterrupted;
}

int Channel::FlushWrite(int want) {
  if (want == 0) want = static_cast<int>(w_size);
  time_t start = time(nullptr);
  int sent = 0;
  while (sent < want) {
    if (flag != nullptr && *flag != 0) return kInterrupted;
    uint32_t run = w_head + w_size > capacity ? capacity - w_head : w_size;
    LOG_DEBUG("WriteFd: from %d, len %d", static_cast<int>(w_head),
              static_cast<int>(run));
    int n = write_op(handle, w_buf + w_head, run, select_slice, flag);
    if (n == kConnectionTimeout) {
      if (timeout != 0 && time(nullptr) - start >= timeout) {
        LOG_WARNING("FlushWrite: Channel timeout for %u seconds", timeout);
        return kConnectionTimeout;
      }
      continue;
    }
    if (n < 0) return n;
    start = time(nullptr);
    sent += n;
    w_head += n;
    w_size -= n;
    if (w_head >= capacity || w_size == 0) w_head = 0;
  }
  LOG_DEBUG("FlushWrite: flush at least %d bytes", want);
  return 0;
}

int Channel::Read(char* buf, unsigned int len, unsigned int& got) {
  if (is_closed_op(handle)) return kIOError;
  // Most reads of a message (tags, lengths, short strings) are served whole
  // from one run of the ring. This is the general path below with n = len
  // and no wrap, so the counters end exactly as it would leave them
  // (including a head left at `capacity`, which only the next read wraps).
  if (len <= r_size && len <= capacity - r_head) {
    CopyBytes(buf, r_buf + r_head, len);
    r_size -= len;
    r_head = r_size == 0 ? 0 : r_head + len;
    got = len;
    LOG_DEBUG("Read: read %d bytes, head = %d, size = %d",
              static_cast<int>(got), static_cast<int>(r_head),
              static_cast<int>(r_size));
    return 0;
  }
  return ReadWrapped(buf, len, got);
}

int Channel::ReadWrapped(char* buf, unsigned int len, unsigned int& got) {
  uint32_t n = std::min(len, r_size);
  uint32_t first = std::min(n, capacity - r_head);
  if (first > 0) memcpy(buf, r_buf + r_head, first);
  if (n > first) memcpy(buf + first, r_buf, n - first);
  r_size -= n;
  if (r_size == 0) {
    r_head = 0;
  } else {
    r_head += n;
    if (r_head > capacity) r_head -= capacity;
  }
  got = n;
  int result = 0;
  while (got < len) {
    uint32_t chunk = std::min(len - got, capacity);
    LOG_DEBUG("want = %d, len = %d, total = %d, capacity = %d",
              static_cast<int>(chunk), static_cast<int>(len),
              static_cast<int>(got), static_cast<int>(capacity));
    result = ReadMore(static_cast<int>(chunk));
    if (result < 0) {
      // Hand over what did arrive; the ring keeps its counters.
      if (r_size > 0) memcpy(buf + got, r_buf, r_size);
      got += r_size;
      break;
    }
    memcpy(buf + got, r_buf, chunk);
    got += chunk;
    r_size -= chunk;
    r_head = r_size == 0 ? 0 : chunk;
  }
  LOG_DEBUG("Read: read %d bytes, head = %d, size = %d", static_cast<int>(got),
            static_cast<int>(r_head), static_cast<int>(r_size));
  return result;
}

int Channel::Read(char* buf, unsigned int len) {
  unsigned int got = 0;
  return Read(buf, len, got);
}

int Channel::Write(const char* buf, unsigned int len) {
  if (is_closed_op(handle)) return kIOError;
  uint32_t tail = w_head + w_size;
  if (tail >= capacity) tail -= capacity;
  // The block fits the ring without a flush and without wrapping: the
  // general path below would copy it in one piece too.
  if (len <= capacity - w_size && len <= capacity - tail) {
    CopyBytes(w_buf + tail, buf, len);
    w_size += len;
    LOG_DEBUG("Write: write %d bytes", static_cast<int>(len));
    return 0;
  }
  return WriteWrapped(buf, len);
}

int Channel::WriteWrapped(const char* buf, unsigned int len) {
  if (len > capacity) {
    LOG_WARNING("Write: Exceed maximum data block size");
    return kInvalidArgument;
  }
  if (w_size + len > capacity) {
    int r = FlushWrite(static_cast<int>(w_size + len - capacity));
    if (r < 0) {
      LOG_WARNING("Write: FlushWrite failed");
      return r;
    }
  }
  uint32_t tail = w_head + w_size;
  if (tail >= capacity) tail -= capacity;
  uint32_t first = std::min(len, capacity - tail);
  if (first > 0) memcpy(w_buf + tail, buf, first);
  if (len > first) memcpy(w_buf, buf + first, len - first);
  w_size += len;
  LOG_DEBUG("Write: write %d bytes", static_cast<int>(len));
  return 0;
}

// ---------------------------------------------------------------------------
// Integers, most significant byte first.

int Channel::ReadByte(unsigned char* v) {
  return Read(reinterpret_cast<char*>(v), 1);
}

int Channel::ReadInt16(unsigned short* v) {
  unsigned char b[2];
  int r = Read(reinterpret_cast<char*>(b), 2);
  if (r == 0) *v = static_cast<unsigned short>((b[0] << 8) | b[1]);
  return r;
}

int Channel::ReadInt32(unsigned int* v) {
  unsigned char b[4];
  int r = Read(reinterpret_cast<char*>(b), 4);
  if (r == 0) {
    *v = (static_cast<unsigned int>(b[0]) << 24) |
         (static_cast<unsigned int>(b[1]) << 16) |
         (static_cast<unsigned int>(b[2]) << 8) | b[3];
  }
  return r;
}

int Channel::ReadInt64(unsigned long long* v) {
  unsigned char b[8];
  int r = Read(reinterpret_cast<char*>(b), 8);
  if (r == 0) {
    unsigned long long x = 0;
    for (unsigned char c : b) x = (x << 8) | c;
    *v = x;
  }
  return r;
}

int Channel::WriteByte(unsigned char v) {
  return Write(reinterpret_cast<const char*>(&v), 1);
}

int Channel::WriteInt16(unsigned short v) {
  char b[2] = {static_cast<char>(v >> 8), static_cast<char>(v)};
  return Write(b, 2);
}

int Channel::WriteInt32(unsigned int v) {
  char b[4];
  for (int i = 3; i >= 0; --i, v >>= 8) b[i] = static_cast<char>(v);
  return Write(b, 4);
}

int Channel::WriteInt64(unsigned long long v) {
  char b[8];
  for (int i = 7; i >= 0; --i, v >>= 8) b[i] = static_cast<char>(v);
  return Write(b, 8);
}

}  // namespace S2S
