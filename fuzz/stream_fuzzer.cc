// Feeds arbitrary bytes to the PStream decoder through a real channel. Any
// answer is fine; a crash, a hang or an overrun is not.
#include <stddef.h>
#include <stdint.h>
#include <sys/socket.h>
#include <unistd.h>

#include "S2S/stream.h"

namespace {
// Small enough to fit the socket buffer in one write, large enough for deep
// nesting and several ring refills.
constexpr size_t kMaxInput = 64 * 1024;
}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size > kMaxInput) return 0;
  int fds[2];
  if (socketpair(AF_UNIX, SOCK_STREAM, 0, fds) != 0) return 0;
  int buf = 4 * kMaxInput;
  setsockopt(fds[1], SOL_SOCKET, SO_SNDBUF, &buf, sizeof buf);
  bool whole = write(fds[1], data, size) == static_cast<ssize_t>(size);
  close(fds[1]);  // the decoder sees the end of the stream, never waits
  S2S::Channel ch(4096);
  ch.SetTimeout(1);
  if (!whole || ch.Open(fds[0], true) != 0) {
    close(fds[0]);
    return 0;
  }
  S2S::PObject obj;
  S2S::PStream().Recv(ch, obj);
  return 0;
}
