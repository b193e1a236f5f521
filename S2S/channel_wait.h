// Internal: the readiness wait that every socket-level operation of Channel
// (plain and TLS, reads, writes, connect and handshake) shares.
#ifndef S2S_CHANNEL_WAIT_H_
#define S2S_CHANNEL_WAIT_H_

#include <sys/time.h>

#include "S2S/channel.h"

namespace S2S {
namespace detail {

enum WaitSet : int {
  kWaitRead = 1,
  kWaitWrite = 2,
  kWaitExcept = 4,
};

// Waits up to one `slice` for `fd` in the sets named by `sets` (a mask of
// WaitSet). Returns the mask of sets that report the descriptor (possibly 0),
// -9 when the slice passed, -1 when `flag` is set before a wait, -3 when
// select fails. EINTR waits again.
int WaitReady(int fd, int sets, const timeval& slice, int* flag);

// Shuts a socket down both ways and closes it, logging as the channel does.
void CloseSocketFd(int fd);

// Fills the five operation slots with the TLS column (channel_ssl.cc).
void InstallSSLOps(Channel::ReadOp* read_op, Channel::WriteOp* write_op,
                   Channel::FdOp* fd_of, Channel::DestroyOp* destroy_op,
                   Channel::IsClosedOp* is_closed_op);

}  // namespace detail
}  // namespace S2S

#endif  // S2S_CHANNEL_WAIT_H_
