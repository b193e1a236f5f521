// The server appliance's rsync daemon as a background process of its own.
//
// Start runs `rsync --daemon --no-detach` on the generated configuration in
// a session of its own, waits until it accepts connections and records its
// pid and port in files under the root; the starting program may then exit.
// Stop signals only the pid in that pid file, and only when that process is
// the rsync daemon of this root's configuration.
#ifndef S2S_TOOLS_SERVER_DAEMON_H_
#define S2S_TOOLS_SERVER_DAEMON_H_

#include <sys/types.h>

#include <string>

namespace s2s_tools {

// Files under the root: the pid and the port of the daemon started here.
std::string ServerPidPath();   // /var/run/s2s-rsyncd.pid
std::string ServerPortPath();  // /var/run/s2s-rsyncd.port
std::string ServerLogPath();   // /var/log/s2s/rsyncd.log

// Starts the daemon on `address` at `port` (0: a free port). True with
// `pid` and `port_out` set, or false with `error`.
bool StartServerDaemon(const std::string& address, int port, pid_t& pid,
                       int& port_out, std::string& error);

// Stops the daemon of the pid file. Returns 1 when it was stopped, 0 when
// none was running (a stale pid file is removed), -1 with `error`.
int StopServerDaemon(std::string& error);

// The pid and port of the running daemon; false when none runs.
bool ServerDaemonRunning(pid_t& pid, int& port);

}  // namespace s2s_tools

#endif  // S2S_TOOLS_SERVER_DAEMON_H_
