#include "server_ssh.h"

#include <fcntl.h>
#include <pwd.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <sstream>
#include <vector>

#include "S2S/is_syncedshare.h"
#include "daemon_config.h"
#include "hooks.h"
#include "karo_root.h"
#include "karo_share.h"
#include "root_files.h"

namespace s2s_tools {

namespace {

std::string SshSecretsPath() {
  return KaroRootPath("/etc/s2s/rsyncd-ssh.secrets");
}

bool ReadAll(const std::string& path, std::string& out) {
  std::ifstream in(path);
  std::stringstream ss;
  ss << in.rdbuf();
  out = ss.str();
  return static_cast<bool>(in);
}

// Writes `data` to `path` with `mode`, owned by uid/gid, in one rename.
bool WriteOwned(const std::string& path, const std::string& data, int mode,
                uid_t uid, gid_t gid) {
  std::string tmp = path + ".tmp";
  unlink(tmp.c_str());
  int fd = open(tmp.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, mode);
  if (fd < 0) return false;
  bool ok =
      fchown(fd, uid, gid) == 0 && fchmod(fd, mode) == 0 &&
      write(fd, data.data(), data.size()) == static_cast<ssize_t>(data.size());
  ok = close(fd) == 0 && ok;
  if (ok && rename(tmp.c_str(), path.c_str()) == 0) return true;
  unlink(tmp.c_str());
  return false;
}

// Where the daemon started over SSH keeps its connection count.
std::string SshRunDir() { return KaroRootPath("/var/run/s2s-ssh"); }

// The daemon configuration as a daemon started over SSH by the user needs
// it: no chroot, uid or gid (only root may), no pid file (it serves one
// connection), a lock file the user may write, its own secrets file.
std::string SshVariant(const std::string& conf) {
  std::istringstream in(conf);
  std::string out;
  for (std::string line; std::getline(in, line);) {
    if (line.compare(0, 6, "uid = ") == 0 ||
        line.compare(0, 6, "gid = ") == 0 ||
        line.compare(0, 11, "pid file = ") == 0) {
      continue;
    }
    if (line == "\tuse chroot = yes") line = "\tmunge symlinks = no";
    // The daemon's and the modules' lock files, in a directory the user
    // may write.
    size_t lock = line[0] == '\t' ? 1 : 0;
    if (line.compare(lock, 12, "lock file = ") == 0) {
      line = line.substr(0, lock + 12) + SshRunDir() +
             line.substr(line.rfind('/'));
    }
    if (line.compare(0, 16, "\tsecrets file = ") == 0) {
      line = "\tsecrets file = " + SshSecretsPath();
    }
    out += line + "\n";
  }
  return out;
}

// The user's uid, gid and home, or false when there is no such user.
bool LookUp(const std::string& name, uid_t& uid, gid_t& gid,
            std::string& home) {
  passwd* pw = getpwnam(name.c_str());
  if (pw == nullptr) return false;
  uid = pw->pw_uid;
  gid = pw->pw_gid;
  home = pw->pw_dir != nullptr ? pw->pw_dir : "";
  return true;
}

// The line of `user` in the daemon's secrets file, or "".
std::string SecretLine(const std::string& user) {
  std::string secrets;
  ReadAll(S2S::server::DaemonSecretsPath(), secrets);
  std::istringstream lines(secrets);
  for (std::string line; std::getline(lines, line);) {
    if (line.compare(0, user.size() + 1, user + ":") == 0) return line + "\n";
  }
  return "";
}

// The SSH configuration and a secrets file with the user's own line only.
bool WriteSshFiles(const std::string& user, uid_t uid, gid_t gid,
                   std::string& error) {
  std::string conf, secret = SecretLine(user);
  if (!ReadAll(S2S::server::DaemonConfigPath(), conf) || secret.empty()) {
    error = "the daemon configuration has no user " + user +
            "; run 's2s-server config --user " + user + "' first";
    return false;
  }
  if (!MakeDirs(SshRunDir(), error) ||
      lchown(SshRunDir().c_str(), uid, gid) != 0 ||
      !WriteOwned(SshConfigPath(), SshVariant(conf), 0644, 0, 0) ||
      !WriteOwned(SshSecretsPath(), secret, 0600, uid, gid)) {
    error = "cannot write " + SshConfigPath() + " and its secrets";
    return false;
  }
  return true;
}

// Gives `path`, with `deep` everything below it too, to uid/gid (links
// themselves).
bool GiveTree(const std::string& path, bool deep, uid_t uid, gid_t gid,
              std::string& error) {
  namespace fs = std::filesystem;
  std::error_code ec;
  if (!fs::exists(path, ec)) return true;
  bool ok = lchown(path.c_str(), uid, gid) == 0;
  for (auto it = fs::recursive_directory_iterator(
           path, fs::directory_options::none, ec);
       deep && ok && !ec && it != fs::recursive_directory_iterator();
       it.increment(ec)) {
    ok = lchown(it->path().c_str(), uid, gid) == 0;
  }
  if (!ok || ec) error = "cannot give " + path + " to the daemon user";
  return ok && !ec;
}

// The directories the daemon and its hooks write to.
std::vector<std::string> StateDirs() {
  std::vector<std::string> dirs = {
      KaroRootPath("/usr/karo/etc"), S2S::server::UploadDir(),
      S2S::server::ReplyDir(),       KaroRootPath(KARO_SHARE_KEY_DIR),
      KaroRootPath("/var/log/s2s"),  KaroRootPath("/tmp/S2S")};
  List names(KLIBCSzListAlloc());
  int count = names ? KAROShareEnum(names.get()) : -1;
  for (int i = 0; i < count; ++i) {
    KARO_SHARE* share = nullptr;
    if (KAROShareGet(KLIBCSzListGet(names.get(), i), &share) != 0) continue;
    if (share->path != nullptr) {
      dirs.push_back(share->path);
      char lower[4096];
      if ((share->status & KARO_SHARE_ENCRYPTED) != 0 &&
          KLIBShareEncryptPathGet(share->path, lower, sizeof lower) == 0) {
        dirs.push_back(lower);
      }
    }
    KAROShareFree(share);
  }
  return dirs;
}

// Adds `key` to `file` with the forced command, replacing a line that
// holds the same key.
bool AuthorizeKey(const std::string& file, const std::string& key, uid_t uid,
                  gid_t gid, std::string& error) {
  std::istringstream words(key);
  std::string type, blob;
  words >> type >> blob;
  if (type.compare(0, 4, "ssh-") != 0 && type.compare(0, 6, "ecdsa-") != 0) {
    error = "not an OpenSSH public key";
    return false;
  }
  std::string dir = file.substr(0, file.rfind('/'));
  if (!MakeDirs(dir, error) || lchown(dir.c_str(), uid, gid) != 0 ||
      chmod(dir.c_str(), 0700) != 0) {
    error = "cannot prepare " + dir;
    return false;
  }
  std::string old, kept;
  ReadAll(file, old);
  std::istringstream lines(old);
  for (std::string line; std::getline(lines, line);) {
    if (line.find(" " + blob) == std::string::npos) kept += line + "\n";
  }
  kept +=
      "restrict,command=\"rsync --server --daemon --config=" + SshConfigPath() +
      " .\" " + type + " " + blob + "\n";
  if (!WriteOwned(file, kept, 0600, uid, gid)) {
    error = "cannot write " + file;
    return false;
  }
  return true;
}

}  // namespace

std::string SshConfigPath() { return KaroRootPath("/etc/s2s/rsyncd-ssh.conf"); }

bool SetUpSsh(const SshSetup& s, std::string& done, std::string& error) {
  uid_t uid;
  gid_t gid;
  std::string home;
  if (geteuid() != 0) {
    error = "ssh-setup hands files to the daemon user: run it as root";
    return false;
  }
  if (!LookUp(s.user, uid, gid, home)) {
    error = "no system user " + s.user +
            " (create it: adduser --system --group --shell /bin/sh " + s.user +
            ")";
    return false;
  }
  if (uid == 0) {
    error = "SSH mode logs in as the daemon user, which may not be root";
    return false;
  }
  std::string key;
  if (!ReadAll(s.key_file, key) || key.empty()) {
    error = "cannot read the public key " + s.key_file;
    return false;
  }
  if (!WriteSshFiles(s.user, uid, gid, error)) return false;
  for (const std::string& dir : StateDirs()) {
    if (!GiveTree(dir, true, uid, gid, error)) return false;
  }
  // A write under the registry's lock hands the lock to the user too.
  if (KAROUISetS2S(1, nullptr, nullptr) != 0) {
    error = "cannot switch the service on in the registry";
    return false;
  }
  std::string file = s.authorized_keys.empty() ? home + "/.ssh/authorized_keys"
                                               : s.authorized_keys;
  if (!AuthorizeKey(file, key, uid, gid, error)) return false;
  done = "ssh: " + s.user +
         " may log in with that key only to run the daemon"
         " on " +
         SshConfigPath() + " (" + file + ")";
  return true;
}

bool RefreshSshConfig(std::string& error) {
  struct stat st;
  if (stat(SshSecretsPath().c_str(), &st) != 0) return true;
  passwd* pw = getpwuid(st.st_uid);
  if (pw == nullptr) {
    error = "the owner of " + SshSecretsPath() + " is no user any more";
    return false;
  }
  if (!WriteSshFiles(pw->pw_name, st.st_uid, st.st_gid, error)) return false;
  // A share added since: its directory goes to the user as well.
  for (const std::string& dir : StateDirs()) {
    if (!GiveTree(dir, false, st.st_uid, st.st_gid, error)) return false;
  }
  return true;
}

}  // namespace s2s_tools
