// Internal: the settings an RsyncWrapper collects and the rsync argument
// vectors built from them. Nothing here starts a process.
#ifndef KARO_RSYNC_ARGS_H_
#define KARO_RSYNC_ARGS_H_

#include <list>
#include <string>
#include <vector>

#include "karo/rsync_wrapper.h"

namespace KARO {
namespace Backup {
namespace detail {

// The daemon's key-file module, the target of an absolute module path.
extern const char kKeyModule[];
// Command channel modules of the server's daemon.
extern const char kCommandModule[];
extern const char kSpoolModule[];
// Where a share's module keeps what interrupted transfers had sent,
// relative to each file's directory.
extern const char kPartialDir[];

struct RsyncSettings {
  bool del = false;
  bool numeric_ids = false;
  bool use_auth = false;
  bool require_auth = false;
  bool pseudo_root = false;
  bool ssh = false;
  unsigned int ssh_port = 0;  // 0: ssh's own default
  bool compress = false;
  bool delta_copy = false;
  bool list_only = false;
  bool relative = false;
  bool acl = false;
  bool debug_log = false;
  unsigned int timeout = 600;
  unsigned int bwlimit = 0;  // KiB/s; 0: none
  std::list<std::string> command_lines;
  std::string user;
  std::string host;
  std::string password;
  std::string module;
  std::string path;
  std::list<std::string> excludes;
  std::string source;
};

// The daemon port: S2S_RSYNC_PORT when it holds a valid port, else 873.
int DaemonPort();

// Returns "" when the settings can make an invocation (a host, a module for a
// data transfer, user and password when authentication is required), else
// what is missing, for the log.
std::string CheckSettings(const RsyncSettings& s, bool command);

// Options every invocation carries: time-outs, the transport (socket options
// or the ssh command), -v for the debug log.
std::vector<std::string> TransportOptions(const RsyncSettings& s);

// The remote side: rsync://[USER@]HOST:PORT/MODULE/PATH, or over SSH
// [USER@]HOST::MODULE/PATH. An absolute `module` becomes kKeyModule.
std::string RemoteSpec(const RsyncSettings& s, const std::string& module,
                       const std::string& path);

// The whole vector of a data transfer in `mode`, "rsync" first, the source
// and the destination last after "--".
std::vector<std::string> DataTransferArgs(
    const RsyncSettings& s, const RsyncWrapper::TransferMode& mode);

}  // namespace detail
}  // namespace Backup
}  // namespace KARO

#endif  // KARO_RSYNC_ARGS_H_
