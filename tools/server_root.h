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
  // share add: a share already there is refused, not replaced.
  bool add_only = false;
};

// Parses "NAME" or "NAME=PATH". False when the name is not a valid share
// name or the path is not absolute.
bool ParseShareSpec(const std::string& text, ShareSpec& out);

// Why `s` cannot be a share of this server, where `others` (name and
// directory) are the shares it keeps, or "". The daemon's configuration
// would misread it (a '%', a blank at the end of its directory, two blanks
// in a row in its name), its name is one of the daemon's own modules or
// differs from another share's only in case, or its directory holds or lies
// within another share's, the server's own state or a system directory.
std::string ServerShareProblem(
    const ShareSpec& s,
    const std::vector<std::pair<std::string, std::string>>& others);

// Adds the shares to /etc/s2s/shares.conf (a share already there is
// replaced, unless `add_only`), after checking them all with
// ServerShareProblem, creates their directories (for an encrypted share its
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
