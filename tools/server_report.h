// What the server admin program shows: the service status and the pairing
// registry, read through the library's registry functions, as text or as
// JSON.
#ifndef S2S_TOOLS_SERVER_REPORT_H_
#define S2S_TOOLS_SERVER_REPORT_H_

#include <stdio.h>
#include <sys/types.h>

namespace s2s_tools {

// True when this root's rsync daemon runs: the one `s2s-server start`
// started (pid and port set), else one that a unit started on the same
// configuration (its pid from the configuration's pid file, port 0).
bool DaemonAlive(pid_t& pid, int& port);

// The service status (running, busy, the paired client or "open to several
// clients"), the daemon's pid and port, each configured share's running and
// completed sync, and each task's status. Returns 0 when the daemon runs,
// 1 when it does not (the status is printed all the same).
int PrintStatus(FILE* out, bool json);

// Every section of the registry with its pairs, in file order. Returns 0,
// or -1 when the registry cannot be read.
int PrintPairings(FILE* out, bool json);

}  // namespace s2s_tools

#endif  // S2S_TOOLS_SERVER_REPORT_H_
