// Setting up an appliance root for the server: its shares, its identity,
// its registry and the rsync daemon's configuration. Every path is under
// the root of S2S_ROOT (set by the caller before these run).
#ifndef S2S_TOOLS_SERVER_ROOT_H_
#define S2S_TOOLS_SERVER_ROOT_H_

#include <string>
#include <vector>

namespace s2s_tools {

struct ShareSpec {
  std::string name;
  std::string path;  // "" for <root>/volume1/<name>
  // Its data lies encrypted in the directory "@<name>@" beside the share's,
  // which the daemon exports as the module "@<name>@".
  bool encrypted = false;
};

struct RootSpec {
  std::vector<ShareSpec> shares;
  std::string hostname;    // "" keeps the machine's
  std::string serial;      // "" keeps the machine's
  bool encrypted = false;  // --encrypted: every share given is encrypted
};

// Parses "NAME" or "NAME=PATH". False when the name is not a valid share
// name or the path is not absolute.
bool ParseShareSpec(const std::string& text, ShareSpec& out);

// Adds the shares to /etc/s2s/shares.conf (a share already there is
// replaced), creates their directories (for an encrypted share its
// encrypted directory too), merges the identity into
// /etc/s2s/platform.conf (names looked up in the root's hosts file only),
// creates the registry with the service switched on, and the directories
// the programs use. True, or false with `error`.
bool InitServerRoot(const RootSpec& spec, std::string& error);

// Writes rsyncd.conf and the secrets file for the daemon user `user`, run
// as this process's uid and gid, with the hooks running `handler`; in SSH
// mode (server_ssh.h) its variant for the daemon started over SSH too.
bool WriteServerConfig(const std::string& handler, const std::string& user,
                       const std::string& password, bool old_server,
                       std::string& error);

// The command handler beside this program or where it was installed, or ""
// when there is none.
std::string DefaultHandler();

}  // namespace s2s_tools

#endif  // S2S_TOOLS_SERVER_ROOT_H_
