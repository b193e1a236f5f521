// SSH mode of a server: clients reach its rsync daemon through sshd, logged
// in as the daemon user (a system user, never root), whose authorized key
// may only start the daemon on this root's configuration. That daemon runs
// as the user, so the user owns the state it writes: the shares, the
// registry, the spool and key directories, and its own secrets file.
#ifndef S2S_TOOLS_SERVER_SSH_H_
#define S2S_TOOLS_SERVER_SSH_H_

#include <string>

namespace s2s_tools {

struct SshSetup {
  std::string user;             // system user = the daemon user
  std::string key_file;         // the client's public key (one line)
  std::string authorized_keys;  // "" for ~user/.ssh/authorized_keys
};

// The configuration the forced command runs the daemon on.
std::string SshConfigPath();  // /etc/s2s/rsyncd-ssh.conf

// Writes rsyncd-ssh.conf and rsyncd-ssh.secrets (owned by the user, 0600)
// from the daemon configuration, hands the state to the user and adds the
// client's key with the forced command (replacing a line with the same
// key). Must run as root. True with `done` saying what was set up, or
// false with `error`.
bool SetUpSsh(const SshSetup& setup, std::string& done, std::string& error);

// Rewrites rsyncd-ssh.conf and its secrets from the daemon configuration
// when SSH mode is set up (after every change of the shares). True, or
// false with `error`.
bool RefreshSshConfig(std::string& error);

}  // namespace s2s_tools

#endif  // S2S_TOOLS_SERVER_SSH_H_
