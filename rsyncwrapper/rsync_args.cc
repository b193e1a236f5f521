#include "rsync_args.h"

#include <stdlib.h>
#include <sys/stat.h>

#include "karo_root.h"

namespace KARO {
namespace Backup {
namespace detail {

const char kKeyModule[] = "s2skeys";
const char kCommandModule[] = "s2scmd";
const char kSpoolModule[] = "s2sspool";
const char kPartialDir[] = ".s2s-partial";

namespace {

const int kDefaultDaemonPort = 873;
const unsigned int kMaxConnectTimeout = 15;

// The client's SSH identity and the server keys it trusts live under the
// root, so that two appliances on one machine keep theirs apart.
const char kSshDir[] = "/etc/s2s/ssh";

bool Exists(const std::string& path) {
  struct stat st;
  return stat(path.c_str(), &st) == 0;
}

// rsync splits the -e value at blanks unless they are quoted.
std::string Quoted(const std::string& word) {
  std::string out = "'";
  for (char c : word) {
    if (c == '\'') {
      out += "'\\''";
    } else {
      out += c;
    }
  }
  return out + "'";
}

std::string SshCommand(const RsyncSettings& s) {
  unsigned int connect = s.timeout < kMaxConnectTimeout && s.timeout > 0
                             ? s.timeout
                             : kMaxConnectTimeout;
  std::string cmd = "ssh";
  if (s.ssh_port != 0) cmd += " -p " + std::to_string(s.ssh_port);
  // Never a prompt: no password, no passphrase, no unknown host key.
  cmd += " -o BatchMode=yes -o StrictHostKeyChecking=yes";
  cmd += " -o ConnectTimeout=" + std::to_string(connect);
  cmd += " -o ServerAliveInterval=" + std::to_string(connect);
  cmd += " -o ServerAliveCountMax=2";
  std::string dir = KaroRootPath(kSshDir);
  if (Exists(dir + "/id_ed25519")) {
    cmd += " -o IdentitiesOnly=yes -i " + Quoted(dir + "/id_ed25519");
  }
  if (Exists(dir + "/known_hosts")) {
    cmd += " -o UserKnownHostsFile=" + Quoted(dir + "/known_hosts");
  }
  return cmd;
}

}  // namespace

int DaemonPort() {
  const char* env = getenv("S2S_RSYNC_PORT");
  if (env == nullptr || *env == '\0') return kDefaultDaemonPort;
  char* end = nullptr;
  long port = strtol(env, &end, 10);
  if (*end != '\0' || port < 1 || port > 65535) return kDefaultDaemonPort;
  return static_cast<int>(port);
}

std::string CheckSettings(const RsyncSettings& s, bool command) {
  if (s.host.empty()) return "no server host";
  if (s.host.find_first_of("/@: \t\n") != std::string::npos) {
    return "malformed server host";
  }
  if (!command && s.module.empty()) return "no module";
  if (!command && s.source.empty()) return "no source path";
  if (s.use_auth && s.require_auth && (s.user.empty() || s.password.empty())) {
    return "authentication required but user or password missing";
  }
  for (const std::string& line : s.command_lines) {
    if (line.find_first_of("\r\n") != std::string::npos) {
      return "command line holds a line break";
    }
  }
  return "";
}

std::vector<std::string> TransportOptions(const RsyncSettings& s) {
  std::vector<std::string> args;
  unsigned int io = s.timeout > 0 ? s.timeout : 600;
  args.push_back("--timeout=" + std::to_string(io));
  if (s.ssh) {
    args.push_back("-e");
    args.push_back(SshCommand(s));
  } else {
    unsigned int connect = io < kMaxConnectTimeout ? io : kMaxConnectTimeout;
    args.push_back("--contimeout=" + std::to_string(connect));
    args.push_back("--sockopts=TCP_NODELAY");
  }
  if (s.debug_log) args.push_back("-v");
  return args;
}

std::string RemoteSpec(const RsyncSettings& s, const std::string& module,
                       const std::string& path) {
  std::string mod = (!module.empty() && module[0] == '/') ? kKeyModule : module;
  std::string user = (s.use_auth && !s.user.empty()) ? s.user + "@" : "";
  std::string where = mod;
  if (!path.empty()) {
    where += (path[0] == '/' ? "" : "/") + path;
  } else {
    where += "/";
  }
  if (s.ssh) return user + s.host + "::" + where;
  return "rsync://" + user + s.host + ":" + std::to_string(DaemonPort()) + "/" +
         where;
}

std::vector<std::string> DataTransferArgs(
    const RsyncSettings& s, const RsyncWrapper::TransferMode& mode) {
  // -H: a share's hard links stay links on the server, not copies.
  // --sparse: a disk image's holes stay holes instead of blocks of zeros.
  std::vector<std::string> args = {"rsync", "-a", "-H", "--sparse"};
  if (s.del) args.push_back("--delete");
  if (s.numeric_ids) args.push_back("--numeric-ids");
  if (!s.pseudo_root) {
    args.insert(args.end(),
                {"--no-owner", "--no-group", "--no-devices", "--no-specials"});
  }
  if (s.compress) args.push_back("-z");
  if (s.bwlimit > 0) args.push_back("--bwlimit=" + std::to_string(s.bwlimit));
  args.push_back(s.delta_copy || mode.resume ? "--no-whole-file"
                                             : "--whole-file");
  // A relative partial directory lies beside each file, inside the module;
  // rsync protects it from --delete and never sends one. Not for the key
  // module, which holds plain files only, nor for a listing.
  if (!s.list_only && !s.module.empty() && s.module[0] != '/') {
    args.push_back(std::string("--partial-dir=") + kPartialDir);
  }
  if (mode.dry_run) args.insert(args.end(), {"--dry-run", "--itemize-changes"});
  if (mode.max_delete >= 0) {
    args.push_back("--max-delete=" + std::to_string(mode.max_delete));
  }
  if (s.list_only) args.push_back("--list-only");
  if (s.relative) args.push_back("-R");
  if (s.acl) args.insert(args.end(), {"-A", "-X"});
  for (const std::string& o : TransportOptions(s)) args.push_back(o);
  for (const std::string& rule : s.excludes)
    args.push_back("--exclude=" + rule);
  // "--" keeps a source path that begins with '-' from being an option.
  args.push_back("--");
  args.push_back(s.source);
  args.push_back(RemoteSpec(s, s.module, s.path));
  return args;
}

}  // namespace detail
}  // namespace Backup
}  // namespace KARO
