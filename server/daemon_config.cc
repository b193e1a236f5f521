#include "daemon_config.h"

#include <errno.h>
#include <fcntl.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <memory>

#include "hooks.h"
#include "karo_root.h"
#include "karo_share.h"
#include "protocol.h"

#define S2S_LOG_AREA "server"
#include "S2S/log.h"

namespace S2S {
namespace server {

bool ShellSafe(const std::string& s) {
  for (unsigned char c : s) {
    if (!isalnum(c) && strchr("/._-+", c) == nullptr) return false;
  }
  return true;
}

namespace {

bool OneLine(const std::string& s) {
  return s.find_first_of("\r\n") == std::string::npos;
}

// Writes through a temporary file and a rename, so that a running daemon
// never reads half a configuration.
bool WriteAtomic(const std::string& path, const std::string& data, int mode) {
  std::string tmp = path + ".tmp";
  int fd = open(tmp.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, mode);
  if (fd < 0) return false;
  bool ok = fchmod(fd, mode) == 0 &&
            write(fd, data.data(), data.size()) ==
                static_cast<ssize_t>(data.size()) &&
            fsync(fd) == 0;
  ok = close(fd) == 0 && ok;
  if (ok && rename(tmp.c_str(), path.c_str()) == 0) return true;
  unlink(tmp.c_str());
  return false;
}

// rsync counts "max connections" over all the modules that share a lock
// file, so each module counts in a file of its own: otherwise commands and
// other shares' transfers would take up a share's few places. The file is
// named by a hash of the module (FNV-1a), which no share name can bend
// into a path.
std::string LockLine(const std::string& module) {
  unsigned long long h = 14695981039346656037ull;
  for (unsigned char c : module) {
    h ^= c;
    h *= 1099511628211ull;
  }
  char hex[17];
  snprintf(hex, sizeof hex, "%016llx", h);
  return "\tlock file = " + DaemonLockPath() + "." + hex + "\n";
}

struct ShareFree {
  void operator()(KARO_SHARE* s) const { KAROShareFree(s); }
};

// The module of one share, or "" (logged) when it cannot be configured.
std::string ShareModule(const std::string& name, const std::string& hook,
                        const std::string& auth) {
  KARO_SHARE* raw = nullptr;
  if (KAROShareGet(name.c_str(), &raw) != 0) {
    LOG_ERROR("cannot read share '%s'", name.c_str());
    return "";
  }
  std::unique_ptr<KARO_SHARE, ShareFree> share(raw);
  bool encrypted = (share->status & KARO_SHARE_ENCRYPTED) != 0;
  std::string path = share->path != nullptr ? share->path : "";
  if (encrypted) {
    char lower[4096];
    if (KLIBShareEncryptPathGet(path.c_str(), lower, sizeof lower) < 0) {
      LOG_ERROR("cannot find the encrypted directory of share '%s'",
                name.c_str());
      return "";
    }
    path = lower;
  }
  if (path.empty() || !OneLine(path) || name.find(':') != std::string::npos) {
    LOG_ERROR("share '%s' cannot be exported", name.c_str());
    return "";
  }
  std::string module = encrypted ? "@" + name + "@" : name;
  // A share keeps its symbolic links as they are. A daemon started by root
  // chroots into the share, which confines the links without rewriting
  // them; otherwise the daemon stores their targets kept inside the share
  // (a leading "/" or escaping "../" dropped) rather than disguised under a
  // prefix that makes every link unusable on this side.
  std::string links =
      geteuid() == 0 ? "\tuse chroot = yes\n" : "\tmunge symlinks = no\n";
  // One sync into a share at a time, plus room for a retry whose
  // predecessor has not ended yet.
  return "[" + module + "]\n\tpath = " + path +
         "\n\tread only = no\n\tlist = no\n\tmax connections = 4\n" +
         LockLine(module) + links + auth + "\tpre-xfer exec = " + hook +
         " data\n";
}

}  // namespace

std::string DaemonConfigPath() { return KaroRootPath("/etc/s2s/rsyncd.conf"); }
std::string DaemonSecretsPath() {
  return KaroRootPath("/etc/s2s/rsyncd.secrets");
}
std::string DaemonPidPath() { return KaroRootPath("/var/run/rsyncd.pid"); }
std::string DaemonLockPath() { return KaroRootPath("/var/run/rsyncd.lock"); }

int WriteDaemonConfig(const DaemonConfig& c) {
  std::string root = KaroRootPrefix();
  if (c.handler.empty() || c.handler[0] != '/' || !ShellSafe(c.handler) ||
      !ShellSafe(root)) {
    LOG_ERROR("handler path or root holds characters a shell interprets");
    return -1;
  }
  if (c.password.empty() || !IsValidDaemonUser(c.user) ||
      !OneLine(c.password)) {
    LOG_ERROR("daemon user or password cannot be written to a secrets file");
    return -1;
  }
  std::error_code ec;
  for (const std::string& dir :
       {KaroRootPath("/etc/s2s"), KaroRootPath("/var/run"), UploadDir(),
        ReplyDir(), KaroRootPath(KARO_SHARE_KEY_DIR)}) {
    std::filesystem::create_directories(dir, ec);
    if (ec) {
      LOG_ERROR("cannot create %s: %s", dir.c_str(), ec.message().c_str());
      return -1;
    }
  }
  // `exec`: the shell the daemon runs a hook through becomes the handler
  // instead of waiting for it in a process of its own.
  std::string hook = "exec " + c.handler +
                     (root.empty() ? "" : " --root " + root) +
                     (c.old_server ? " --old-server" : "");
  // The users configured before stay; `c.user` is added or gets its new
  // password. One user per client keeps one client's secret from opening
  // another's syncs.
  std::string secrets = c.user + ":" + c.password + "\n";
  std::string users = c.user;
  {
    std::ifstream in(DaemonSecretsPath());
    std::string line;
    while (std::getline(in, line)) {
      std::string name = line.substr(0, line.find(':'));
      if (name.size() == line.size() || name == c.user ||
          !IsValidDaemonUser(name)) {
        continue;
      }
      secrets += line + "\n";
      users += "," + name;
    }
  }
  std::string auth = "\tauth users = " + users +
                     "\n\tsecrets file = " + DaemonSecretsPath() + "\n";
  std::string conf =
      "# Generated by the S2S server; changes are overwritten.\n"
      "pid file = " +
      DaemonPidPath() + "\nlock file = " + DaemonLockPath() +
      "\nuse chroot = no\n"
      "socket options = TCP_NODELAY\n"
      // Access is by user and password; a reverse lookup of every peer
      // would only add a resolver round trip to each connection.
      "reverse lookup = no\n";
  // Only a daemon started by root can change to another user (setgroups).
  // Owners it cannot set itself would go to extended attributes with `fake
  // super`, but rsync then stores symbolic links as plain files (Linux has
  // no user attributes on links), so a daemon not started by root keeps
  // the links and leaves owners to the user it runs as.
  if (c.as_root) {
    conf += "uid = " + std::to_string(c.uid) +
            "\ngid = " + std::to_string(c.gid) + "\n";
    if (c.uid != 0) conf += "fake super = yes\n";
  }
  // Command pulls carry one file and never delete; uploads are single files
  // that no transfer may delete or nest in directories. A key push is the
  // client's data transfer (-a --delete), so the key module cannot refuse
  // those options; its hook confines a push to the key file of a share
  // whose sync the pusher holds, and trees are filtered and removed.
  // A command is one hook: the early input carries it, the early hook
  // answers it into the connection's daemon user's directory, and the same
  // connection pulls the answer. The path keeps one user's pulls (a glob
  // included) away from the others' replies.
  conf += std::string("[") + kCommandModule + "]\n\tpath = " + ReplyDir() +
          "/%RSYNC_USER_NAME%\n\tread only = yes\n\tlist = no\n"
          "\tmax connections = 64\n" +
          LockLine(kCommandModule) + "\trefuse options = delete recursive\n" +
          auth + "\tearly exec = " + hook + " early\n";
  conf += std::string("[") + kSpoolModule + "]\n\tpath = " + UploadDir() +
          "\n\tread only = no\n\twrite only = yes\n\tlist = no\n"
          "\tmax connections = 16\n" +
          LockLine(kSpoolModule) +
          "\trefuse options = delete recursive dirs links devices specials\n"
          "\tincoming chmod = u=rw,go=\n" +
          auth + "\tpre-xfer exec = " + hook +
          " upload\n\tpost-xfer exec = " + hook + " upload-done\n";
  conf += std::string("[") + kKeyModule +
          "]\n\tpath = " + KaroRootPath(KARO_SHARE_KEY_DIR) +
          "\n\tread only = no\n\twrite only = yes\n\tlist = no\n"
          "\tmax connections = 8\n" +
          LockLine(kKeyModule) +
          "\tfilter = - /*/**\n\tincoming chmod = u=rw,go=\n" + auth +
          "\tpre-xfer exec = " + hook + " keys\n\tpost-xfer exec = " + hook +
          " keys-done\n";

  KSZLIST* names = KLIBCSzListAlloc();
  int count = names != nullptr ? KAROShareEnum(names) : -1;
  for (int i = 0; i < count; ++i) {
    std::string module = ShareModule(KLIBCSzListGet(names, i), hook, auth);
    if (module.empty()) {
      count = -1;
      break;
    }
    conf += module;
  }
  KLIBCSzListFree(names);
  if (count < 0) {
    LOG_ERROR("cannot list the shares for the daemon configuration");
    return -1;
  }
  if (!WriteAtomic(DaemonSecretsPath(), secrets, 0600) ||
      !WriteAtomic(DaemonConfigPath(), conf, 0644)) {
    LOG_ERROR("cannot write the daemon configuration: %s", strerror(errno));
    return -1;
  }
  return 0;
}

}  // namespace server
}  // namespace S2S
