// Generation of the server's rsync daemon configuration from its share
// configuration: rsyncd.conf and the secrets file, both under the root.
//
// Modules: one per configured share (named after the share, "@share@" for an
// encrypted one, whose module is its encrypted lower directory), each
// guarded by the handler's "data" hook; "s2scmd" (commands, answered by the
// early hook into a reply directory per daemon user), "s2sspool" (write-only
// upload of large commands) and "s2skeys" (the key-file directory, guarded by
// the "keys" hook). All modules require the daemon users; each has a connection
// limit and refuses the options it has no use for (deletes everywhere but the
// share modules).
#ifndef S2S_SERVER_DAEMON_CONFIG_H_
#define S2S_SERVER_DAEMON_CONFIG_H_

#include <sys/types.h>
#include <unistd.h>

#include <string>

namespace S2S {
namespace server {

// Whether `s` holds only characters a hook line may carry unquoted through
// a shell (letters, digits and "/._-+"): true or false.
bool ShellSafe(const std::string& s);

struct DaemonConfig {
  // Absolute path of the command handler program the hooks run.
  std::string handler;
  // A daemon user and its password (goes only to the secrets file). Users
  // already in the secrets file stay; this one is added or replaced.
  std::string user;
  std::string password;
  // Who the daemon's transfers run as, when the daemon is started by root.
  uid_t uid = 0;
  gid_t gid = 0;
  // Whether root starts the daemon. Otherwise it runs as whoever starts it:
  // no uid or gid lines (which would need setgroups) and no `fake super`.
  bool as_root = geteuid() == 0;
  // The handler behaves as an old server (protocol version 0).
  bool old_server = false;
};

// Where the files go (under the root).
std::string DaemonConfigPath();   // /etc/s2s/rsyncd.conf
std::string DaemonSecretsPath();  // /etc/s2s/rsyncd.secrets
std::string DaemonPidPath();      // /var/run/rsyncd.pid
std::string DaemonLockPath();     // /var/run/rsyncd.lock (max connections)

// Writes both files (the secrets file with mode 0600) and creates the spool
// directories. Returns 0, or -1 (logged) when a value cannot be written
// safely (a handler path or root with characters a shell would interpret, a
// user or password that the secrets file cannot hold, a share path with a
// line break) or a file cannot be written.
int WriteDaemonConfig(const DaemonConfig& config);

}  // namespace server
}  // namespace S2S

#endif  // S2S_SERVER_DAEMON_CONFIG_H_
