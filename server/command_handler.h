// The server commands: what the handler does with a parsed command file,
// on top of the registry functions of libs2s. One call per command; the
// caller (the daemon hook) turns the result into a reply file.
//
// Every name taken from the command is validated before it reaches the
// registry or the share configuration. Thread-safety: none needed; each
// daemon connection runs its own handler process.
#ifndef S2S_SERVER_COMMAND_HANDLER_H_
#define S2S_SERVER_COMMAND_HANDLER_H_

#include <time.h>

#include <string>

#include "command_file.h"

namespace S2S {
namespace server {

struct HandlerContext {
  // Behave as a server of protocol version 0: no "S2S_GetProtocolVer", no
  // "S2S_PairingMultiSrc", no share attributes in "S2S_SyncStart".
  bool old_server = false;
  // Who is asking, as the daemon saw it: the peer's address and the daemon
  // user it logged in as. Recorded at sync start, checked for data pushes.
  std::string peer_address;
  std::string peer_user;
  // When the client stops waiting for the answer (seconds since the epoch),
  // or 0 for no limit beyond the registry's own lock wait. A command that
  // cannot have the registry lock before then is not applied.
  time_t deadline = 0;
};

// Runs `cmd`. Returns a protocol status (protocol.h); `answer` receives the
// text that follows the status line (possibly empty). Failures are logged.
//
// Every command but the version query runs under the registry lock, from
// its checks to its writes. A client id is bound to the daemon user of its
// first pairing or sync start ("CLIENTUSER_<id>"); a command that names it
// from another daemon user gets kBadId. A registry that vanished from a root
// that had one gets kRegistryFailure rather than a fresh, open registry.
int HandleCommand(const CommandFile& cmd, const HandlerContext& ctx,
                  std::string* answer);

// Whether the peer may push into the data module of `share`: the service is
// on and the share's running sync was started by this peer address and user.
// Returns true when allowed; `why` says why not.
bool MayPushShare(const std::string& share, const HandlerContext& ctx,
                  std::string* why);

// Whether the peer may run a dry run (a push that changes nothing) into the
// data module of `share`: the service is on and the share is fed by no
// client, or by one bound to the peer's daemon user. Returns true when
// allowed; `why` says why not.
bool MayDryRunShare(const std::string& share, const HandlerContext& ctx,
                    std::string* why);

// Records that this root has a registry (a marker beside it), so that its
// disappearance is noticed. Returns 0, or -1 (logged).
int MarkRegistryInitialised();

}  // namespace server
}  // namespace S2S

#endif  // S2S_SERVER_COMMAND_HANDLER_H_
