// Changing a server root that is already set up: its shares, a stuck sync,
// the pairing. The daemon's configuration follows every change of the
// shares; the rsync daemon reads it afresh at each connection, so a running
// daemon serves the change from the next connection on.
#ifndef S2S_TOOLS_SERVER_SHARES_H_
#define S2S_TOOLS_SERVER_SHARES_H_

#include <stdio.h>

#include <string>

namespace s2s_tools {

// Rewrites rsyncd.conf and the secrets file for the shares configured now,
// with the handler, daemon user and password of the configuration already
// there. Returns 1 when rewritten, 0 when the root has no daemon
// configuration yet (nothing to do), -1 with `error`.
int RegenerateServerConfig(std::string& error);

// Removes share `name` from the share configuration (its data stays).
// True, or false with `error` (also when there is no such share).
bool RemoveServerShare(const std::string& name, std::string& error);

// One line per configured share: name, path, "encrypted", the client whose
// sync runs into it. 0, or -1 when the configuration cannot be read.
int PrintShares(FILE* out);

// Clears the running sync of share `name` (RunningID and where it came
// from), so that its client, or another, may start again. Sets `was` to the
// client that held it ("" when none did). True, or false with `error` (no
// such share, registry not writable).
bool ReleaseShare(const std::string& name, std::string& was,
                  std::string& error);

}  // namespace s2s_tools

#endif  // S2S_TOOLS_SERVER_SHARES_H_
