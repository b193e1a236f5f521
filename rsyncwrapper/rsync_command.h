// Internal: the command channel. A command is sent to the daemon's command
// module and its reply pulled back, in one rsync connection when the command
// fits in --early-input and in two (push to the spool module, then pull)
// when it does not. The reply file is "status=<N>\n" followed by the answer.
#ifndef KARO_RSYNC_COMMAND_H_
#define KARO_RSYNC_COMMAND_H_

#include <boost/function.hpp>
#include <string>

#include "rsync_args.h"

namespace KARO {
namespace Backup {
namespace detail {

// The most --early-input carries.
const size_t kMaxEarlyInput = 5120;
// The largest reply taken from a server; a larger one fails with
// kReplyTooLarge and is neither kept on disk nor read.
const size_t kMaxReply = 1 << 20;
// The longest reason text a reply's status line may carry; more is cut.
const size_t kMaxReason = 256;

// Runs the command in `s.command_lines`. Returns the server's status, rsync's
// exit code when a connection failed, or kStartFailed, kBadReply or
// kReplyTooLarge. The answer
// goes to the `outfile="..."` line's path when there is one.
int RunCommand(const RsyncSettings& s, const boost::function<bool()>& cancel);

// Splits a reply into its status, its answer and the reason text after the
// status ("" when none; control characters become '?'); false when it is not
// a reply.
bool ParseReply(const std::string& reply, int* status, std::string* answer,
                std::string* reason);

// A fresh request id: 32 lower-case hex digits.
std::string NewRequestId();

}  // namespace detail
}  // namespace Backup
}  // namespace KARO

#endif  // KARO_RSYNC_COMMAND_H_
